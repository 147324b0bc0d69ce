#include "targets/platform/files.h"

#include "targets/platform/linux/proc_reader.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

namespace vs {

namespace {

FileFailure failure(int error, std::string reason) {
    return FileFailure{error, std::move(reason)};
}

FileFailure systemFailure(int error, const std::string &what) {
    return failure(error, what + ": " + std::strerror(error));
}

// What a file that is not a regular file is, for messages.
const char *kindOf(mode_t mode) {
    switch (mode & S_IFMT) {
    case S_IFLNK:
        return "a symbolic link";
    case S_IFIFO:
        return "a FIFO";
    case S_IFCHR:
        return "a character device";
    case S_IFBLK:
        return "a block device";
    case S_IFSOCK:
        return "a socket";
    case S_IFDIR:
        return "a directory";
    default:
        return "not a regular file";
    }
}

int errorFor(mode_t mode) {
    switch (mode & S_IFMT) {
    case S_IFLNK:
        return ELOOP;
    case S_IFDIR:
        return EISDIR;
    default:
        return EINVAL;
    }
}

bool writeAll(int fd, std::string_view contents, int &error) {
    while (!contents.empty()) {
        const ssize_t n = ::write(fd, contents.data(), contents.size());
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            error = errno;
            return false;
        }
        contents.remove_prefix(static_cast<size_t>(n));
    }
    // A full disk or an exceeded quota may only show when the data goes out.
    if (::fsync(fd) != 0 && errno != EINVAL && errno != EROFS) {
        error = errno;
        return false;
    }
    return true;
}

std::string temporaryName(const std::string &base) {
    uint64_t random = 0;
    if (::getrandom(&random, sizeof random, GRND_NONBLOCK) != static_cast<ssize_t>(sizeof random)) {
        // Without entropy the exclusive create still keeps names apart; it
        // may only take more attempts.
        random = static_cast<uint64_t>(::getpid()) * 0x9E3779B97F4A7C15ull ^
                 reinterpret_cast<uintptr_t>(&random);
    }
    char suffix[24];
    std::snprintf(suffix, sizeof suffix, ".%016llx.tmp", static_cast<unsigned long long>(random));
    // Hidden, and short enough to stay within the name limit.
    std::string name = ".";
    name.append(base, 0, 200);
    name += suffix;
    return name;
}

// The directory part and the last name of `path`.
bool splitPath(const std::string &path, std::string &directory, std::string &base) {
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos) {
        directory = ".";
        base = path;
    } else {
        directory = slash == 0 ? "/" : path.substr(0, slash);
        base = path.substr(slash + 1);
    }
    return !base.empty() && base != "." && base != "..";
}

// The directory cannot take a new file: change the file in place, but only
// a regular file of the caller's own, reached without following a link.
std::optional<FileFailure> writeInPlace(int directory, const std::string &path, const std::string &base,
                                        std::string_view contents) {
    UniqueFd fd(::openat(directory, base.c_str(), O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd.valid()) {
        return systemFailure(errno, path);
    }
    struct stat st {};
    if (::fstat(fd.get(), &st) != 0) {
        return systemFailure(errno, path);
    }
    if (!S_ISREG(st.st_mode)) {
        return failure(errorFor(st.st_mode), path + " is " + kindOf(st.st_mode) + ", not a regular file");
    }
    if (st.st_uid != ::geteuid()) {
        return failure(EACCES, path + " belongs to another user and its directory is not writable; not replaced");
    }
    if ((st.st_mode & (S_ISUID | S_ISGID)) != 0) {
        ::fchmod(fd.get(), st.st_mode & 0777);
    }
    int error = 0;
    if (::ftruncate(fd.get(), 0) != 0 || !writeAll(fd.get(), contents, error)) {
        return systemFailure(error != 0 ? error : errno, path);
    }
    if (::close(fd.release()) != 0) {
        return systemFailure(errno, path);
    }
    return std::nullopt;
}

} // namespace

std::optional<FileFailure> writeOutputFile(const std::string &path, std::string_view contents, unsigned mode) {
    std::string directoryName;
    std::string base;
    if (!splitPath(path, directoryName, base)) {
        return failure(EISDIR, (path.empty() ? std::string("an empty path") : path) + " does not name a file");
    }
    UniqueFd directory(::open(directoryName.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!directory.valid()) {
        return systemFailure(errno, directoryName);
    }

    struct stat existing {};
    bool exists = false;
    if (::fstatat(directory.get(), base.c_str(), &existing, AT_SYMLINK_NOFOLLOW) == 0) {
        if (!S_ISREG(existing.st_mode)) {
            return failure(errorFor(existing.st_mode),
                           path + " is " + kindOf(existing.st_mode) +
                               "; vestage writes only regular files and never follows a link there");
        }
        exists = true;
        // Renaming needs only a writable directory: keep a read-only file
        // meaningful to a caller who could not write it.
        if (::faccessat(directory.get(), base.c_str(), W_OK, AT_EACCESS) != 0) {
            return systemFailure(errno, path);
        }
    } else if (errno != ENOENT) {
        return systemFailure(errno, path);
    }
    // A file of the caller's own keeps its permissions; anyone else's file
    // is replaced by one made as new.
    const bool keepPermissions = exists && existing.st_uid == ::geteuid();

    std::string temporary;
    UniqueFd fd;
    for (int attempt = 0; attempt < 100 && !fd.valid(); ++attempt) {
        temporary = temporaryName(base);
        fd = UniqueFd(::openat(directory.get(), temporary.c_str(),
                               O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC, mode & 0777));
        if (!fd.valid() && errno != EEXIST) {
            const int error = errno;
            if ((error == EACCES || error == EPERM) && exists) {
                return writeInPlace(directory.get(), path, base, contents);
            }
            return systemFailure(error, "cannot create a file in " + directoryName);
        }
    }
    if (!fd.valid()) {
        return failure(EEXIST, "cannot create a temporary file in " + directoryName);
    }
    auto discard = [&](int error, const std::string &what) {
        ::unlinkat(directory.get(), temporary.c_str(), 0);
        return systemFailure(error, what);
    };
    if (keepPermissions) {
        ::fchmod(fd.get(), existing.st_mode & 0777);
    }
    int error = 0;
    if (!writeAll(fd.get(), contents, error)) {
        return discard(error, path);
    }
    if (::close(fd.release()) != 0) {
        return discard(errno, path);
    }
    if (::renameat(directory.get(), temporary.c_str(), directory.get(), base.c_str()) != 0) {
        return discard(errno, path);
    }
    return std::nullopt;
}

std::optional<std::string> readRegularFile(const std::string &path, uint64_t maxBytes, FileFailure &result) {
    auto fail = [&](FileFailure f) -> std::optional<std::string> {
        result = std::move(f);
        return std::nullopt;
    };
    auto checked = [&](const struct stat &st) -> std::optional<FileFailure> {
        if (!S_ISREG(st.st_mode)) {
            return failure(errorFor(st.st_mode), std::string(kindOf(st.st_mode)) + ", not a regular file");
        }
        if (static_cast<uint64_t>(st.st_size) > maxBytes) {
            return failure(EFBIG, "larger than " + std::to_string(maxBytes >> 20) + " MiB, the most vestage reads");
        }
        return std::nullopt;
    };
    // Asked first by name, so that a FIFO or a device is never opened.
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) {
        return fail(failure(errno, std::strerror(errno)));
    }
    if (auto bad = checked(st)) {
        return fail(*bad);
    }
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd.valid() || ::fstat(fd.get(), &st) != 0) {
        return fail(failure(errno, std::strerror(errno)));
    }
    if (auto bad = checked(st)) { // replaced between the two looks
        return fail(*bad);
    }
    std::string bytes;
    bytes.resize(static_cast<size_t>(st.st_size));
    size_t filled = 0;
    while (true) {
        if (filled == bytes.size()) {
            if (bytes.size() > maxBytes) {
                return fail(failure(EFBIG, "grew past " + std::to_string(maxBytes >> 20) +
                                               " MiB, the most vestage reads"));
            }
            bytes.resize(bytes.size() + 65536);
        }
        const ssize_t n = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return fail(failure(errno, std::strerror(errno)));
        }
        if (n == 0) {
            break;
        }
        filled += static_cast<size_t>(n);
    }
    bytes.resize(filled);
    return bytes;
}

} // namespace vs
