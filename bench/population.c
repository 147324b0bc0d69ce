/*
 * Synthetic population for the benchmark: one launcher forks N children,
 * each of which lays out about K small mappings of its own and maps two
 * regions that every child of every launcher shares, then sleeps until it
 * is killed.
 *
 *   vsbench_pop N K PARENT_PID SHARED_FD SHM_FD SMALL_FD...
 *
 * The file descriptors are opened by the caller: a file mapped MAP_SHARED
 * by everybody, a /dev/shm file mapped MAP_SHARED by everybody, and a few
 * small files that the children map privately in one- and two-page pieces.
 * The launcher prints "ready" on standard output once every child has
 * finished its mappings, or "error: ..." and exits 1.
 *
 * Everything dies with its parent (PR_SET_PDEATHSIG), so the population
 * cannot outlive the benchmark even if the benchmark is killed with
 * SIGKILL.  Children keep their memory small: a few hundred KiB each.
 */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#define MAX_SMALL_FILES 16

static long page;

struct shared_setup {
    int shared_fd;
    off_t shared_size;
    int shm_fd;
    off_t shm_size;
    int small_fds[MAX_SMALL_FILES];
    long small_pages[MAX_SMALL_FILES];
    int small_count;
};

static int die_with_parent(pid_t expected_parent)
{
    if (prctl(PR_SET_PDEATHSIG, SIGKILL) != 0)
        return -1;
    /* The parent may have died before the call above took effect. */
    return getppid() == expected_parent ? 0 : -1;
}

static off_t file_size(int fd)
{
    struct stat st;
    if (fstat(fd, &st) != 0)
        return -1;
    return st.st_size;
}

/* Reads one byte of every page so that the pages are resident in this process. */
static unsigned touch_read(const volatile unsigned char *p, size_t len)
{
    unsigned sum = 0;
    for (size_t off = 0; off < len; off += (size_t)page)
        sum += p[off];
    return sum;
}

/*
 * Lays out K mappings inside one reserved stretch of address space, with a
 * one-page hole after each one so that the kernel never merges neighbours.
 * The mix: about 58% private anonymous (1-4 pages, every other page
 * written), 38% small file pieces (a third of those written, i.e.
 * copy-on-write dirty), and a PROT_NONE guard page as every 25th mapping.
 */
static int make_own_mappings(const struct shared_setup *s, int k, int child)
{
    size_t max_pages = 5; /* largest mapping (4) + hole (1) */
    size_t reserve = (size_t)k * max_pages * (size_t)page;
    unsigned char *base = mmap(NULL, reserve, PROT_NONE,
                               MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (base == MAP_FAILED)
        return -1;
    /* Free the stretch again and place the mappings into it with MAP_FIXED:
     * nothing else in this single-threaded child maps memory meanwhile. */
    if (munmap(base, reserve) != 0)
        return -1;

    unsigned char *cursor = base;
    volatile unsigned sink = 0;
    for (int i = 0; i < k; i++) {
        int kind = i % 25 == 24 ? 2 : (i % 10 < 6 ? 0 : 1);
        size_t pages;
        void *m;
        if (kind == 0) {
            pages = 1 + (size_t)((i * 7 + child) % 4);
            m = mmap(cursor, pages * (size_t)page, PROT_READ | PROT_WRITE,
                     MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED, -1, 0);
            if (m == MAP_FAILED)
                return -1;
            for (size_t p = 0; p < pages; p += 2)
                ((volatile unsigned char *)m)[p * (size_t)page] = (unsigned char)(i + 1);
        } else if (kind == 1) {
            int f = (i + child) % s->small_count;
            pages = 1 + (size_t)(i % 2);
            long offset_pages = (i / 3 + child) % (s->small_pages[f] - (long)pages + 1);
            int writable = i % 3 == 0;
            m = mmap(cursor, pages * (size_t)page,
                     writable ? PROT_READ | PROT_WRITE : PROT_READ,
                     MAP_PRIVATE | MAP_FIXED, s->small_fds[f], offset_pages * page);
            if (m == MAP_FAILED)
                return -1;
            sink += touch_read(m, pages * (size_t)page);
            if (writable)
                ((volatile unsigned char *)m)[0] = (unsigned char)i;
        } else {
            pages = 1;
            m = mmap(cursor, (size_t)page, PROT_NONE,
                     MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE | MAP_FIXED, -1, 0);
            if (m == MAP_FAILED)
                return -1;
        }
        cursor += (pages + 1) * (size_t)page;
    }
    (void)sink;
    return 0;
}

static int map_shared_regions(const struct shared_setup *s)
{
    unsigned char *file = mmap(NULL, (size_t)s->shared_size, PROT_READ, MAP_SHARED,
                               s->shared_fd, 0);
    if (file == MAP_FAILED)
        return -1;
    unsigned char *shm = mmap(NULL, (size_t)s->shm_size, PROT_READ | PROT_WRITE,
                              MAP_SHARED, s->shm_fd, 0);
    if (shm == MAP_FAILED)
        return -1;
    volatile unsigned sink = touch_read(file, (size_t)s->shared_size);
    sink += touch_read(shm, (size_t)s->shm_size);
    (void)sink;
    return 0;
}

static void child_main(const struct shared_setup *s, int k, int child, int ready_fd,
                       pid_t launcher)
{
    /* Only the launcher talks to the benchmark. */
    int devnull = open("/dev/null", O_RDWR);
    if (devnull >= 0) {
        dup2(devnull, STDIN_FILENO);
        dup2(devnull, STDOUT_FILENO);
        close(devnull);
    }
    char status = 'r';
    if (die_with_parent(launcher) != 0 || map_shared_regions(s) != 0
        || make_own_mappings(s, k, child) != 0)
        status = 'e';
    if (write(ready_fd, &status, 1) != 1 || status != 'r')
        _exit(1);
    close(ready_fd);
    for (;;)
        pause();
}

int main(int argc, char **argv)
{
    if (argc < 7) {
        fprintf(stderr, "usage: %s N K PARENT_PID SHARED_FD SHM_FD SMALL_FD...\n", argv[0]);
        return 2;
    }
    page = sysconf(_SC_PAGESIZE);
    int n = atoi(argv[1]);
    int k = atoi(argv[2]);
    pid_t parent = (pid_t)atol(argv[3]);
    struct shared_setup s = {0};
    s.shared_fd = atoi(argv[4]);
    s.shm_fd = atoi(argv[5]);
    for (int a = 6; a < argc && s.small_count < MAX_SMALL_FILES; a++) {
        int fd = atoi(argv[a]);
        s.small_fds[s.small_count] = fd;
        s.small_pages[s.small_count] = (long)(file_size(fd) / page);
        if (s.small_pages[s.small_count] < 2) {
            printf("error: small file fd %d is shorter than two pages\n", fd);
            return 1;
        }
        s.small_count++;
    }
    s.shared_size = file_size(s.shared_fd);
    s.shm_size = file_size(s.shm_fd);
    if (n < 1 || k < 1 || s.shared_size <= 0 || s.shm_size <= 0) {
        printf("error: bad arguments (N=%d K=%d shared=%lld shm=%lld)\n", n, k,
               (long long)s.shared_size, (long long)s.shm_size);
        return 1;
    }
    if (die_with_parent(parent) != 0) {
        printf("error: parent went away\n");
        return 1;
    }

    int ready[2];
    if (pipe(ready) != 0) {
        printf("error: pipe: %s\n", strerror(errno));
        return 1;
    }
    /* A fork family: memory written once, then shared by every child. */
    const char *family = getenv("VSBENCH_FAMILY_MIB");
    if (family != NULL && atol(family) > 0) {
        size_t bytes = (size_t)atol(family) << 20;
        char *memory = mmap(NULL, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (memory == MAP_FAILED) {
            printf("error: family memory: %s\n", strerror(errno));
            return 1;
        }
        for (size_t at = 0; at < bytes; at += (size_t)page)
            memory[at] = (char)(at >> 12);
    }
    pid_t self = getpid();
    for (int c = 0; c < n; c++) {
        pid_t pid = fork();
        if (pid < 0) {
            printf("error: fork of child %d: %s\n", c, strerror(errno));
            return 1; /* the children die with us */
        }
        if (pid == 0) {
            close(ready[0]);
            child_main(&s, k, c, ready[1], self);
        }
    }
    close(ready[1]);

    int got = 0, failed = 0;
    char buf[256];
    while (got < n) {
        ssize_t r = read(ready[0], buf, sizeof buf);
        if (r < 0 && errno == EINTR)
            continue;
        if (r <= 0)
            break;
        for (ssize_t i = 0; i < r; i++)
            failed += buf[i] != 'r';
        got += (int)r;
    }
    if (got < n || failed) {
        printf("error: %d of %d children ready, %d failed to map\n", got - failed, n, failed);
        return 1;
    }
    printf("ready\n");
    fflush(stdout);

    /* Stay the parent so the children stay alive; reap any that die. */
    for (;;) {
        if (wait(NULL) < 0 && errno == ECHILD)
            pause();
    }
}
