#include "targets/platform/linux/proc_reader.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <new>
#include <sys/mman.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace vs {

namespace {

// Large enough for the smaps of most processes in one or two reads.
constexpr size_t kInitialBuffer = 256 * 1024;

// Room for a read of a record file and the line it may cut (a smaps
// header line is at most a path of 4096 bytes and a hundred more).
constexpr size_t kPieceBuffer = 16 * 1024;

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

namespace {

// Reads from offset 0 until a read returns nothing or, for files the kernel
// makes in one piece, until a read does not fill what it was given.
int readFrom(int fd, ReadBuffer &buffer, std::string_view &text, size_t chunk, bool shortReadEnds) {
    if (buffer.capacity() == 0) {
        buffer.reserve(kInitialBuffer);
    }
    size_t used = 0;
    for (;;) {
        if (used == buffer.capacity()) {
            buffer.reserve(buffer.capacity() * 2); // keeps what was read
        }
        const size_t asked = std::min(chunk, buffer.capacity() - used);
        const ssize_t n = ::pread(fd, buffer.data() + used, asked, static_cast<off_t>(used));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return errno;
        }
        used += static_cast<size_t>(n);
        if (n == 0 || (shortReadEnds && static_cast<size_t>(n) < asked)) {
            break;
        }
    }
    text = std::string_view(buffer.data(), used);
    return 0;
}

int readOpened(int dirFd, const char *name, ReadBuffer &buffer, std::string_view &text, bool shortReadEnds) {
    const int fd = ::openat(dirFd, name, O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    const int error = readFrom(fd, buffer, text, SIZE_MAX, shortReadEnds);
    ::close(fd);
    return error;
}

} // namespace

int readAll(int fd, ReadBuffer &buffer, std::string_view &text, size_t chunk) {
    return readFrom(fd, buffer, text, chunk, false);
}

int readInPieces(int fd, size_t chunk, const std::function<size_t(std::string_view)> &consume, uint64_t &total) {
    // Holds what is not taken yet (a line still arriving) plus one read.
    thread_local std::vector<char> buffer(kPieceBuffer);
    size_t kept = 0;
    total = 0;
    for (;;) {
        if (kept == buffer.size()) {
            buffer.resize(buffer.size() * 2); // a line longer than the buffer
        }
        const size_t asked = std::min(chunk, buffer.size() - kept);
        const ssize_t n = ::pread(fd, buffer.data() + kept, asked, static_cast<off_t>(total));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return errno;
        }
        if (n == 0) {
            return 0;
        }
        total += static_cast<uint64_t>(n);
        const size_t have = kept + static_cast<size_t>(n);
        const size_t taken = std::min(consume(std::string_view(buffer.data(), have)), have);
        kept = have - taken;
        std::memmove(buffer.data(), buffer.data() + taken, kept);
    }
}

int readFileAt(int dirFd, const char *name, ReadBuffer &buffer, std::string_view &text) {
    return readOpened(dirFd, name, buffer, text, false);
}

int readFileAt(int dirFd, const char *name, std::string_view &text) {
    return readOpened(dirFd, name, threadReadBuffer(), text, false);
}

int readOnePieceFileAt(int dirFd, const char *name, std::string_view &text) {
    return readOpened(dirFd, name, threadReadBuffer(), text, true);
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
