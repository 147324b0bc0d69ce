#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

#include "cli/run.h"

namespace {

// A crash helper is started with standard output and standard error closed
// (and the core on standard input). Left closed, the first files the run
// opens would take their numbers, and the report would be written into
// them. Standard input is never read: while the core is not drained the
// crashed process stays intact for the walk.
void reopenClosedStandardStreams() {
    for (int fd = 0; fd <= 2; ++fd) {
        if (::fcntl(fd, F_GETFD) != -1 || errno != EBADF) {
            continue;
        }
        int placeholder = ::open("/dev/null", O_RDWR);
        if (placeholder < 0) {
            // Without /dev/null any descriptor that refuses writes will do.
            placeholder = ::open("/", O_PATH);
        }
        if (placeholder >= 0 && placeholder != fd) {
            ::dup2(placeholder, fd);
            ::close(placeholder);
        }
    }
}

}  // namespace

int main(int argc, char **argv) {
    reopenClosedStandardStreams();
    return vsMain(argc, argv);
}
