#pragma once

// Reading /proc files whole. Every read goes through openat() on a held
// /proc/PID directory fd: once the process is reaped every open through
// that fd fails with ESRCH, so a reused pid is never read by mistake.
//
// Files are read with a few large pread() calls into a buffer that belongs
// to the calling thread and is reused for every file it reads; the text
// stays valid until the same thread's next read.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string_view>

namespace vs {

// Memory for whole-file reads. It is mapped from the kernel directly and
// grows by remapping, which keeps what was read without copying it and
// touches no page the file does not fill (a symbol table of several
// megabytes would otherwise be copied and faulted in at every doubling).
class ReadBuffer {
public:
    ReadBuffer() = default;
    ReadBuffer(ReadBuffer &&other) noexcept;
    ReadBuffer &operator=(ReadBuffer &&other) noexcept;
    ReadBuffer(const ReadBuffer &) = delete;
    ReadBuffer &operator=(const ReadBuffer &) = delete;
    ~ReadBuffer();

    char *data() { return _data; }
    size_t capacity() const { return _capacity; }
    // Grows to at least `bytes`, keeping the contents.
    void reserve(size_t bytes);

private:
    char *_data = nullptr;
    size_t _capacity = 0;
};

// The buffer of the calling thread.
ReadBuffer &threadReadBuffer();

// Reads all of an open fd from offset 0 into `buffer`, at most `chunk`
// bytes per read. On success returns 0 and sets `text`; otherwise returns
// the errno.
int readAll(int fd, ReadBuffer &buffer, std::string_view &text, size_t chunk = SIZE_MAX);

// Reads all of an open fd from offset 0, `chunk` bytes per read, through a
// buffer of the calling thread that does not grow with the file: after each
// read `consume` gets the text it has not taken yet (what it left last
// time, then the new bytes) and returns how many bytes it took from the
// front; the rest is given again with the next read. Returns 0 or the
// errno, and sets `total` to the bytes read.
int readInPieces(int fd, size_t chunk, const std::function<size_t(std::string_view)> &consume, uint64_t &total);

// The read size for files the kernel writes record by record, one page of
// records per read (smaps). A record that no longer fits into that page is
// made, thrown away and made again by the next read; a smaps record is
// 1-1.5 KiB, so reads of this size stop before the page fills and no
// record is made twice. That saves about a tenth of the kernel's work for
// a few more reads.
constexpr size_t kRecordFileChunk = 3072;

// Opens `name` relative to `dirFd` (AT_FDCWD for absolute paths), reads it
// whole into the thread's buffer and closes it. Returns 0 or the errno.
int readFileAt(int dirFd, const char *name, std::string_view &text);

// Same, into the given buffer.
int readFileAt(int dirFd, const char *name, ReadBuffer &buffer, std::string_view &text);

// Same, for the files the kernel makes in one piece (stat, status,
// cmdline, meminfo): a read that does not fill the buffer got all of it,
// so the read that would only find the end is left out.
int readOnePieceFileAt(int dirFd, const char *name, std::string_view &text);

// Reads up to `size` bytes at `offset` of `name` under `dirFd` into `out`:
// a regular file or one the kernel makes in one piece, so a short read is
// its end. Returns the bytes read, or -errno.
int64_t readBytesAt(int dirFd, const char *name, uint64_t offset, void *out, size_t size);

// An fd closed on destruction.
class UniqueFd {
public:
    UniqueFd() = default;
    explicit UniqueFd(int fd) : _fd(fd) {}
    UniqueFd(UniqueFd &&other) noexcept : _fd(other.release()) {}
    UniqueFd &operator=(UniqueFd &&other) noexcept;
    UniqueFd(const UniqueFd &) = delete;
    UniqueFd &operator=(const UniqueFd &) = delete;
    ~UniqueFd();

    int get() const { return _fd; }
    bool valid() const { return _fd >= 0; }
    int release() {
        const int fd = _fd;
        _fd = -1;
        return fd;
    }

private:
    int _fd = -1;
};

} // namespace vs
