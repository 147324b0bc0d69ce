#include "targets/platform/linux/proc_reader.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <new>
#include <sys/mman.h>
#include <unistd.h>
#include <utility>

namespace vs {

namespace {

// Large enough for the smaps of most processes in one or two reads.
constexpr size_t kInitialBuffer = 256 * 1024;

} // namespace

ReadBuffer::ReadBuffer(ReadBuffer &&other) noexcept
    : _data(std::exchange(other._data, nullptr)), _capacity(std::exchange(other._capacity, 0)) {}

ReadBuffer &ReadBuffer::operator=(ReadBuffer &&other) noexcept {
    if (this != &other) {
        if (_data != nullptr) {
            ::munmap(_data, _capacity);
        }
        _data = std::exchange(other._data, nullptr);
        _capacity = std::exchange(other._capacity, 0);
    }
    return *this;
}

ReadBuffer::~ReadBuffer() {
    if (_data != nullptr) {
        ::munmap(_data, _capacity);
    }
}

void ReadBuffer::reserve(size_t bytes) {
    if (bytes <= _capacity) {
        return;
    }
    const size_t page = static_cast<size_t>(::sysconf(_SC_PAGESIZE));
    bytes = (bytes + page - 1) / page * page;
    void *grown = _data == nullptr
                      ? ::mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0)
                      : ::mremap(_data, _capacity, bytes, MREMAP_MAYMOVE);
    if (grown == MAP_FAILED) {
        throw std::bad_alloc();
    }
    _data = static_cast<char *>(grown);
    _capacity = bytes;
}

ReadBuffer &threadReadBuffer() {
    thread_local ReadBuffer buffer;
    return buffer;
}

int readAll(int fd, ReadBuffer &buffer, std::string_view &text, size_t chunk) {
    if (buffer.capacity() == 0) {
        buffer.reserve(kInitialBuffer);
    }
    size_t used = 0;
    for (;;) {
        if (used == buffer.capacity()) {
            buffer.reserve(buffer.capacity() * 2); // keeps what was read
        }
        const ssize_t n = ::pread(fd, buffer.data() + used, std::min(chunk, buffer.capacity() - used),
                                  static_cast<off_t>(used));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return errno;
        }
        if (n == 0) {
            break;
        }
        used += static_cast<size_t>(n);
    }
    text = std::string_view(buffer.data(), used);
    return 0;
}

int readFileAt(int dirFd, const char *name, ReadBuffer &buffer, std::string_view &text) {
    const int fd = ::openat(dirFd, name, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    const int error = readAll(fd, buffer, text);
    ::close(fd);
    return error;
}

int readFileAt(int dirFd, const char *name, std::string_view &text) {
    return readFileAt(dirFd, name, threadReadBuffer(), text);
}

int readOnePieceFileAt(int dirFd, const char *name, std::string_view &text) {
    const int fd = ::openat(dirFd, name, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    ReadBuffer &buffer = threadReadBuffer();
    if (buffer.capacity() == 0) {
        buffer.reserve(kInitialBuffer);
    }
    ssize_t n;
    do {
        n = ::pread(fd, buffer.data(), buffer.capacity(), 0);
    } while (n < 0 && errno == EINTR);
    int error = n < 0 ? errno : 0;
    if (n >= 0 && static_cast<size_t>(n) < buffer.capacity()) {
        text = std::string_view(buffer.data(), static_cast<size_t>(n));
    } else if (n >= 0) {
        error = readAll(fd, buffer, text); // larger than the buffer after all
    }
    ::close(fd);
    return error;
}

int64_t readBytesAt(int dirFd, const char *name, uint64_t offset, void *out, size_t size) {
    const int fd = ::openat(dirFd, name, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return -errno;
    }
    ssize_t n;
    do {
        n = ::pread(fd, out, size, static_cast<off_t>(offset));
    } while (n < 0 && errno == EINTR);
    const int64_t result = n < 0 ? -errno : n;
    ::close(fd);
    return result;
}

UniqueFd &UniqueFd::operator=(UniqueFd &&other) noexcept {
    if (this != &other) {
        if (_fd >= 0) {
            ::close(_fd);
        }
        _fd = other.release();
    }
    return *this;
}

UniqueFd::~UniqueFd() {
    if (_fd >= 0) {
        ::close(_fd);
    }
}

} // namespace vs
