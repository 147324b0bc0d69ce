/*
 * One process with many mappings, for the benchmark's single-process case:
 *
 *   vsbench_maps N PARENT_PID FILE_FD
 *
 * Lays out N one-page mappings, each followed by an unmapped page so that
 * the kernel cannot merge neighbours: three in four private anonymous
 * (every sixteenth mapping written, so resident and dirty), one in four a
 * read-only private page of the file at FILE_FD (read, so resident page
 * cache shared with the file). Prints "ready" on standard output, or
 * "error: ..." and exits 1, then sleeps until it is killed.
 *
 * It dies with its parent (PR_SET_PDEATHSIG), so it cannot outlive the
 * benchmark even if the benchmark is killed with SIGKILL. Written pages
 * cost 4 KiB each: about 250 MiB at a million mappings.
 */
#define _GNU_SOURCE
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

int main(int argc, char **argv)
{
    if (argc != 4) {
        fprintf(stderr, "usage: %s N PARENT_PID FILE_FD\n", argv[0]);
        return 2;
    }
    long n = atol(argv[1]);
    pid_t parent = (pid_t)atol(argv[2]);
    int fd = atoi(argv[3]);
    size_t page = (size_t)sysconf(_SC_PAGESIZE);
    struct stat st;
    if (n < 1 || fstat(fd, &st) != 0 || st.st_size < (off_t)page) {
        printf("error: bad arguments (N=%ld, file fd %d)\n", n, fd);
        return 1;
    }
    if (prctl(PR_SET_PDEATHSIG, SIGKILL) != 0 || getppid() != parent) {
        printf("error: parent went away\n");
        return 1;
    }
    long file_pages = (long)(st.st_size / (off_t)page);

    /* Reserve the stretch, free it, and place every mapping into it with
     * MAP_FIXED: nothing else in this single-threaded process maps memory
     * meanwhile. */
    size_t reserve = (size_t)n * 2 * page;
    unsigned char *base = mmap(NULL, reserve, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (base == MAP_FAILED || munmap(base, reserve) != 0) {
        printf("error: reserving %zu bytes: %s\n", reserve, strerror(errno));
        return 1;
    }
    volatile unsigned sink = 0;
    for (long i = 0; i < n; i++) {
        unsigned char *at = base + (size_t)i * 2 * page;
        void *m;
        if (i % 4 == 3) {
            m = mmap(at, page, PROT_READ, MAP_PRIVATE | MAP_FIXED, fd, (off_t)((i / 4) % file_pages) * (off_t)page);
            if (m != MAP_FAILED)
                sink += ((volatile unsigned char *)m)[0];
        } else {
            m = mmap(at, page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED, -1, 0);
            if (m != MAP_FAILED && i % 16 == 0)
                ((volatile unsigned char *)m)[0] = (unsigned char)(i + 1);
        }
        if (m == MAP_FAILED) {
            printf("error: mapping %ld of %ld: %s\n", i + 1, n, strerror(errno));
            return 1;
        }
    }
    (void)sink;
    printf("ready\n");
    fflush(stdout);
    for (;;)
        pause();
}
