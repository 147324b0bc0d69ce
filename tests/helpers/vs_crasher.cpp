// A process that crashes on request, for the tests of crash-snapshot runs.
//
//   vs_crasher PAGES stop    writes PAGES pages of private anonymous memory,
//                            prints "ready pid=PID anon=ADDRESS", stops
//                            itself (SIGSTOP) and exits 0 once continued
//   vs_crasher PAGES crash   the same memory and line, then waits for a
//                            line on standard input and dies of SIGSEGV,
//                            dumping core
//
// The memory sits between two inaccessible pages so that it stays one
// region of exactly PAGES pages.

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sys/mman.h>
#include <sys/resource.h>
#include <unistd.h>

int main(int argc, char **argv) {
    if (argc != 3) {
        std::fprintf(stderr, "usage: vs_crasher PAGES stop|crash\n");
        return 2;
    }
    const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    const size_t pages = std::strtoul(argv[1], nullptr, 10);
    const bool crash = std::strcmp(argv[2], "crash") == 0;

    char *area = static_cast<char *>(mmap(nullptr, (pages + 2) * page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    if (area == MAP_FAILED || mprotect(area + page, pages * page, PROT_READ | PROT_WRITE) != 0) {
        std::perror("vs_crasher: mmap");
        return 2;
    }
    char *memory = area + page;
    for (size_t i = 0; i < pages; ++i) {
        memory[i * page] = static_cast<char>(i | 1);
    }
    std::printf("ready pid=%d anon=%p\n", static_cast<int>(getpid()), static_cast<void *>(memory));
    std::fflush(stdout);

    if (!crash) {
        raise(SIGSTOP);
        return 0;
    }
    // A core limit of 1 makes the kernel refuse to hand a crash to a
    // helper; any other limit is ignored for helpers.
    struct rlimit limit;
    if (getrlimit(RLIMIT_CORE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_CORE, &limit);
    }
    char line[16];
    if (std::fgets(line, sizeof line, stdin) == nullptr) {
        return 0;  // the test went away: nothing to crash for
    }
    std::signal(SIGSEGV, SIG_DFL);
    raise(SIGSEGV);
    return 3;
}
