// A child process with memory arranged as its arguments say, for the tests
// of the Linux layer. Each argument arranges one item and prints one line
// "LABEL key=value ..." (addresses in hex) on standard output; after the
// last item it prints "ready" and waits until standard input reaches end of
// file, then undoes nothing and exits 0.
//
//   anon:LABEL:PAGES:TOUCHED[:READ]
//                                private anonymous memory, first TOUCHED
//                                pages written, the READ pages after them
//                                only read (the kernel's shared zero page)
//   file:LABEL:PATH[:FIRST:COUNT]
//                                PATH mapped read-only and private, every
//                                page read (or pages FIRST to FIRST+COUNT)
//   shared:LABEL:PAGES[:TOUCHED] shared anonymous memory, every page (or the
//                                first TOUCHED pages) written
//   pfile:LABEL:PATH:WRITTEN     PATH mapped private and writable, every
//                                page read, the first WRITTEN pages written
//   sfile:LABEL:PATH             PATH mapped shared and writable, untouched
//   shm:LABEL:NAME:PAGES         a POSIX shared memory object /dev/shm/NAME
//                                mapped shared, every page written
//   memfd:LABEL:NAME:PAGES       a memfd named NAME mapped shared, every page
//                                written
//   sysv:LABEL:PAGES             a private SysV segment attached, every page
//                                written (removed at once, so it goes with us)
//   sparse:LABEL:GIB:TOUCHED     GIB GiB of anonymous address space reserved,
//                                the first TOUCHED pages written
//   tables:LABEL:GIB             GIB GiB of anonymous address space reserved,
//                                one page written in every 2 MiB, so that
//                                each needs a page table of its own
//   mlock:LABEL:PAGES            anonymous memory written and locked
//   free:LABEL:PAGES:FREED       anonymous memory written, then the first
//                                FREED pages given back with MADV_FREE (and
//                                the kernel's per-cpu page batches drained,
//                                so that smaps counts them at once)
//   exec:LABEL:PAGES             anonymous memory written, then made
//                                executable (what a JIT does)
//   none:LABEL:PAGES             anonymous memory without any access
//   thread:LABEL                 a thread blocked in read(); prints its tid
//                                and the address of a local variable
//   libc:LABEL                   prints libc's path and load bias and its
//                                PT_LOAD / PT_GNU_RELRO headers
//   fork:LABEL                   forks a grandchild that shares everything
//                                arranged so far, writes every page of the
//                                shared items (fork does not copy their page
//                                tables) and waits like this one; prints its
//                                pid
//   fork:LABEL:ITEM:FIRST:COUNT  the same, but the grandchild writes only
//                                pages FIRST to FIRST+COUNT of item ITEM
//   fork:LABEL:ITEM:move         the same, but the grandchild writes nothing
//                                and moves item ITEM to another address
//                                (mremap, as realloc does with large blocks)
//
// Every anonymous item is placed between two inaccessible pages so that the
// kernel cannot merge it with a neighbour of the same protection.

#include <algorithm>
#include <atomic>
#include <sched.h>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <link.h>
#include <memory>
#include <pthread.h>
#include <string>
#include <sys/mman.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace {

const size_t kPage = static_cast<size_t>(sysconf(_SC_PAGESIZE));

[[noreturn]] void fail(const std::string &what) {
    std::fprintf(stderr, "vs_memchild: %s: %s\n", what.c_str(), std::strerror(errno));
    std::exit(2);
}

std::vector<std::string> split(const std::string &text) {
    std::vector<std::string> parts;
    size_t pos = 0;
    for (;;) {
        const size_t colon = text.find(':', pos);
        parts.push_back(text.substr(pos, colon - pos));
        if (colon == std::string::npos) {
            return parts;
        }
        pos = colon + 1;
    }
}

size_t number(const std::string &text) {
    return static_cast<size_t>(std::strtoul(text.c_str(), nullptr, 10));
}

// Anonymous memory of `pages` pages between two inaccessible pages.
char *fencedAnonymous(size_t pages, int protection) {
    const size_t total = (pages + 2) * kPage;
    void *base = mmap(nullptr, total, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (base == MAP_FAILED) {
        fail("mmap");
    }
    char *start = static_cast<char *>(base) + kPage;
    if (mprotect(start, pages * kPage, protection) != 0) {
        fail("mprotect");
    }
    // Huge pages would turn page counts into 2 MiB steps.
    madvise(start, pages * kPage, MADV_NOHUGEPAGE);
    return start;
}

void touch(char *start, size_t pages) {
    for (size_t i = 0; i < pages; ++i) {
        start[i * kPage] = static_cast<char>(i + 1);
    }
}

void printRegion(const std::string &label, const void *start, size_t pages) {
    std::printf("%s start=%lx size=%zx\n", label.c_str(), reinterpret_cast<unsigned long>(start),
                pages * kPage);
}

int gBlockPipe[2] = {-1, -1};
std::atomic<long> gLastThreadId{0};
int gStartedPipe[2] = {-1, -1};

void *blockedThread(void *arg) {
    const std::string label = *static_cast<std::string *>(arg);
    volatile char local = 0;
    gLastThreadId.store(static_cast<long>(syscall(SYS_gettid)));
    std::printf("%s tid=%ld local=%lx\n", label.c_str(), static_cast<long>(syscall(SYS_gettid)),
                reinterpret_cast<unsigned long>(&local));
    std::fflush(stdout);
    const char started = 1;
    if (write(gStartedPipe[1], &started, 1) != 1) {
        fail("write");
    }
    char c;
    while (read(gBlockPipe[0], &c, 1) < 0 && errno == EINTR) {
    }
    return nullptr;
}

int printLoads(dl_phdr_info *info, size_t, void *data) {
    const std::string &label = *static_cast<std::string *>(data);
    const char *name = info->dlpi_name;
    if (name == nullptr || std::strstr(name, "/libc.so") == nullptr) {
        return 0;
    }
    char resolved[PATH_MAX];
    if (realpath(name, resolved) == nullptr) {
        fail("realpath");
    }
    std::printf("%s path=%s bias=%lx", label.c_str(), resolved,
                static_cast<unsigned long>(info->dlpi_addr));
    for (int i = 0; i < info->dlpi_phnum; ++i) {
        const ElfW(Phdr) &ph = info->dlpi_phdr[i];
        if (ph.p_type == PT_LOAD) {
            std::printf(" load=%lx,%lx,%x", static_cast<unsigned long>(ph.p_vaddr),
                        static_cast<unsigned long>(ph.p_memsz), ph.p_flags);
        } else if (ph.p_type == PT_GNU_RELRO) {
            std::printf(" relro=%lx,%lx", static_cast<unsigned long>(ph.p_vaddr),
                        static_cast<unsigned long>(ph.p_memsz));
        }
    }
    std::printf("\n");
    return 1;
}

// The kernel marks MADV_FREE pages lazily, from per-cpu batches. An
// invalidation that fails on mapped pages drains the batches of every cpu.
void drainPageBatches() {
    const int fd = open("/proc/self/exe", O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        fail("open exe");
    }
    posix_fadvise(fd, 0, 0, POSIX_FADV_DONTNEED);
    close(fd);
}

struct SharedItem {
    char *start;
    size_t pages;
};
std::vector<SharedItem> gSharedItems;
// Every item with memory, by label, for the writes of a fork.
std::vector<std::pair<std::string, SharedItem>> gItems;

void remember(const std::string &label, void *start, size_t pages) {
    gItems.push_back({label, {static_cast<char *>(start), pages}});
}

char *mapFile(const std::string &path, int flags, size_t &pages) {
    const int fd = open(path.c_str(), O_RDWR | O_CLOEXEC);
    struct stat st {};
    if (fd < 0 || fstat(fd, &st) != 0) {
        fail("open " + path);
    }
    pages = (static_cast<size_t>(st.st_size) + kPage - 1) / kPage;
    void *start = mmap(nullptr, pages * kPage, PROT_READ | PROT_WRITE, flags, fd, 0);
    if (start == MAP_FAILED) {
        fail("mmap " + path);
    }
    close(fd);
    return static_cast<char *>(start);
}

void waitForEndOfInput() {
    char buffer[64];
    for (;;) {
        const ssize_t n = read(STDIN_FILENO, buffer, sizeof buffer);
        if (n == 0 || (n < 0 && errno != EINTR)) {
            return;
        }
    }
}

} // namespace

int main(int argc, char **argv) {
    if (pipe(gBlockPipe) != 0 || pipe(gStartedPipe) != 0) {
        fail("pipe");
    }
    std::vector<pid_t> grandchildren;
    for (int i = 1; i < argc; ++i) {
        const std::vector<std::string> item = split(argv[i]);
        const std::string &kind = item[0];
        const std::string label = item.size() > 1 ? item[1] : kind;
        if (kind == "anon" && (item.size() == 4 || item.size() == 5)) {
            const size_t pages = number(item[2]);
            char *start = fencedAnonymous(pages, PROT_READ | PROT_WRITE);
            touch(start, number(item[3]));
            const size_t read = item.size() == 5 ? std::min(number(item[4]), pages - std::min(pages, number(item[3]))) : 0;
            unsigned sum = 0;
            for (size_t p = number(item[3]); p < number(item[3]) + read; ++p) {
                sum += static_cast<unsigned char>(static_cast<volatile char *>(start)[p * kPage]);
            }
            if (sum != 0) {
                fail("fresh anonymous memory read as nonzero");
            }
            remember(label, start, pages);
            printRegion(label, start, pages);
        } else if (kind == "pfile" && item.size() == 4) {
            size_t pages = 0;
            char *start = mapFile(item[2], MAP_PRIVATE, pages);
            unsigned sum = 0;
            for (size_t p = 0; p < pages; ++p) {
                sum += static_cast<unsigned char>(static_cast<volatile char *>(start)[p * kPage]);
            }
            touch(start, std::min(pages, number(item[3])));
            remember(label, start, pages);
            std::printf("%s start=%lx size=%zx sum=%u\n", label.c_str(), reinterpret_cast<unsigned long>(start),
                        pages * kPage, sum);
        } else if (kind == "sfile" && item.size() == 3) {
            size_t pages = 0;
            char *start = mapFile(item[2], MAP_SHARED, pages);
            remember(label, start, pages);
            printRegion(label, start, pages);
        } else if (kind == "file" && (item.size() == 3 || item.size() == 5)) {
            const int fd = open(item[2].c_str(), O_RDONLY | O_CLOEXEC);
            struct stat st {};
            if (fd < 0 || fstat(fd, &st) != 0) {
                fail("open " + item[2]);
            }
            const size_t pages = (static_cast<size_t>(st.st_size) + kPage - 1) / kPage;
            auto *start = static_cast<volatile char *>(
                mmap(nullptr, pages * kPage, PROT_READ, MAP_PRIVATE, fd, 0));
            if (start == MAP_FAILED) {
                fail("mmap file");
            }
            close(fd);
            const size_t first = item.size() == 5 ? std::min(pages, number(item[3])) : 0;
            const size_t count = item.size() == 5 ? std::min(pages - first, number(item[4])) : pages;
            unsigned sum = 0;
            for (size_t p = first; p < first + count; ++p) {
                sum += static_cast<unsigned char>(start[p * kPage]);
            }
            std::printf("%s start=%lx size=%zx sum=%u\n", label.c_str(),
                        reinterpret_cast<unsigned long>(start), pages * kPage, sum);
        } else if (kind == "shared" && (item.size() == 3 || item.size() == 4)) {
            const size_t pages = number(item[2]);
            void *start = mmap(nullptr, pages * kPage, PROT_READ | PROT_WRITE,
                               MAP_SHARED | MAP_ANONYMOUS, -1, 0);
            if (start == MAP_FAILED) {
                fail("mmap shared");
            }
            const size_t touched = item.size() == 4 ? std::min(pages, number(item[3])) : pages;
            touch(static_cast<char *>(start), touched);
            gSharedItems.push_back({static_cast<char *>(start), touched});
            remember(label, start, pages);
            printRegion(label, start, pages);
        } else if (kind == "shm" && item.size() == 4) {
            const size_t pages = number(item[3]);
            const std::string path = "/dev/shm/" + item[2];
            const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
            if (fd < 0 || ftruncate(fd, static_cast<off_t>(pages * kPage)) != 0) {
                fail("shm " + path);
            }
            void *start = mmap(nullptr, pages * kPage, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
            if (start == MAP_FAILED) {
                fail("mmap shm");
            }
            close(fd);
            touch(static_cast<char *>(start), pages);
            gSharedItems.push_back({static_cast<char *>(start), pages});
            remember(label, start, pages);
            printRegion(label, start, pages);
        } else if (kind == "sparse" && item.size() == 4) {
            const size_t bytes = number(item[2]) << 30;
            void *start = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE,
                               -1, 0);
            if (start == MAP_FAILED) {
                fail("mmap sparse");
            }
            madvise(start, bytes, MADV_NOHUGEPAGE);
            touch(static_cast<char *>(start), number(item[3]));
            remember(label, start, bytes / kPage);
            printRegion(label, start, bytes / kPage);
        } else if (kind == "tables" && item.size() == 3) {
            const size_t bytes = number(item[2]) << 30;
            constexpr size_t kTableSpan = 2u << 20; // what one page table maps
            void *start = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE,
                               -1, 0);
            if (start == MAP_FAILED) {
                fail("mmap tables");
            }
            madvise(start, bytes, MADV_NOHUGEPAGE);
            for (size_t at = 0; at < bytes; at += kTableSpan) {
                static_cast<char *>(start)[at] = 1;
            }
            remember(label, start, bytes / kPage);
            printRegion(label, start, bytes / kPage);
        } else if (kind == "memfd" && item.size() == 4) {
            const size_t pages = number(item[3]);
            const int fd = memfd_create(item[2].c_str(), MFD_CLOEXEC);
            if (fd < 0 || ftruncate(fd, static_cast<off_t>(pages * kPage)) != 0) {
                fail("memfd " + item[2]);
            }
            void *start = mmap(nullptr, pages * kPage, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
            if (start == MAP_FAILED) {
                fail("mmap memfd");
            }
            close(fd);
            touch(static_cast<char *>(start), pages);
            remember(label, start, pages);
            printRegion(label, start, pages);
        } else if (kind == "sysv" && item.size() == 3) {
            const size_t pages = number(item[2]);
            const int id = shmget(IPC_PRIVATE, pages * kPage, IPC_CREAT | 0600);
            void *start = id < 0 ? reinterpret_cast<void *>(-1) : shmat(id, nullptr, 0);
            if (start == reinterpret_cast<void *>(-1)) {
                fail("shmget");
            }
            shmctl(id, IPC_RMID, nullptr);
            touch(static_cast<char *>(start), pages);
            remember(label, start, pages);
            printRegion(label, start, pages);
        } else if (kind == "mlock" && item.size() == 3) {
            const size_t pages = number(item[2]);
            char *start = fencedAnonymous(pages, PROT_READ | PROT_WRITE);
            touch(start, pages);
            // The system call itself: sanitizer runtimes turn mlock() into a no-op.
            if (syscall(SYS_mlock, start, pages * kPage) != 0) {
                fail("mlock");
            }
            printRegion(label, start, pages);
        } else if (kind == "free" && item.size() == 4) {
            const size_t pages = number(item[2]);
            char *start = fencedAnonymous(pages, PROT_READ | PROT_WRITE);
            touch(start, pages);
            if (madvise(start, number(item[3]) * kPage, MADV_FREE) != 0) {
                fail("madvise");
            }
            drainPageBatches();
            printRegion(label, start, pages);
        } else if (kind == "exec" && item.size() == 3) {
            const size_t pages = number(item[2]);
            char *start = fencedAnonymous(pages, PROT_READ | PROT_WRITE);
            touch(start, pages);
            if (mprotect(start, pages * kPage, PROT_READ | PROT_EXEC) != 0) {
                fail("mprotect exec");
            }
            printRegion(label, start, pages);
        } else if (kind == "none" && item.size() == 3) {
            const size_t pages = number(item[2]);
            // Readable fences keep the inaccessible item a mapping of its own.
            const size_t total = (pages + 2) * kPage;
            void *base = mmap(nullptr, total, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
            if (base == MAP_FAILED) {
                fail("mmap none");
            }
            char *start = static_cast<char *>(base) + kPage;
            if (mprotect(start, pages * kPage, PROT_NONE) != 0) {
                fail("mprotect none");
            }
            printRegion(label, start, pages);
        } else if (kind == "thread" && item.size() == 2) {
            static std::vector<std::unique_ptr<std::string>> labels;
            labels.push_back(std::make_unique<std::string>(label));
            pthread_t thread;
            if (pthread_create(&thread, nullptr, blockedThread, labels.back().get()) != 0) {
                fail("pthread_create");
            }
            pthread_detach(thread);
            char started;
            if (read(gStartedPipe[0], &started, 1) != 1) {
                fail("read");
            }
            // Said before it blocks: until its syscall file names the read,
            // a reader would find it running and without a stack pointer.
            const std::string syscallFile = "/proc/self/task/" + std::to_string(gLastThreadId.load()) + "/syscall";
            for (;;) {
                char text[64] = {};
                const int fd = open(syscallFile.c_str(), O_RDONLY | O_CLOEXEC);
                const ssize_t n = fd < 0 ? -1 : read(fd, text, sizeof text - 1);
                if (fd >= 0) {
                    close(fd);
                }
                if (n > 0 && std::strncmp(text, "running", 7) != 0) {
                    break;
                }
                sched_yield();
            }
        } else if (kind == "libc" && item.size() == 2) {
            std::string copy = label;
            dl_iterate_phdr(printLoads, &copy);
        } else if (kind == "fork" && (item.size() == 2 || item.size() == 5 || (item.size() == 4 && item[3] == "move"))) {
            SharedItem written{nullptr, 0};
            SharedItem moved{nullptr, 0};
            if (item.size() > 2) {
                const auto found = std::find_if(gItems.begin(), gItems.end(),
                                                [&](const auto &entry) { return entry.first == item[2]; });
                if (found == gItems.end() ||
                    (item.size() == 5 && number(item[3]) + number(item[4]) > found->second.pages)) {
                    std::fprintf(stderr, "vs_memchild: no such pages '%s'\n", argv[i]);
                    return 2;
                }
                if (item.size() == 5) {
                    written = {found->second.start + number(item[3]) * kPage, number(item[4])};
                } else {
                    moved = found->second;
                }
            }
            std::fflush(stdout);
            int done[2];
            if (pipe(done) != 0) {
                fail("pipe");
            }
            const pid_t pid = fork();
            if (pid < 0) {
                fail("fork");
            }
            if (pid == 0) {
                if (moved.start != nullptr) {
                    char *to = fencedAnonymous(moved.pages, PROT_READ | PROT_WRITE);
                    if (mremap(moved.start, moved.pages * kPage, moved.pages * kPage, MREMAP_MAYMOVE | MREMAP_FIXED,
                               to) == MAP_FAILED) {
                        fail("mremap");
                    }
                } else if (written.start != nullptr) {
                    touch(written.start, written.pages);
                } else {
                    for (const SharedItem &shared : gSharedItems) {
                        touch(shared.start, shared.pages);
                    }
                }
                const char byte = 1;
                if (write(done[1], &byte, 1) != 1) {
                    fail("write");
                }
                waitForEndOfInput();
                _exit(0);
            }
            char byte;
            if (read(done[0], &byte, 1) != 1) {
                fail("read");
            }
            close(done[0]);
            close(done[1]);
            grandchildren.push_back(pid);
            std::printf("%s pid=%d\n", label.c_str(), static_cast<int>(pid));
        } else {
            std::fprintf(stderr, "vs_memchild: bad item '%s'\n", argv[i]);
            return 2;
        }
    }
    std::printf("ready\n");
    std::fflush(stdout);
    waitForEndOfInput();
    for (pid_t pid : grandchildren) {
        waitpid(pid, nullptr, 0);
    }
    return 0;
}
