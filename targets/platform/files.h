#pragma once

// Files the program reads and writes on the user's behalf. vestage mostly
// runs as root, often in directories any local user can write (/tmp), and
// the names it is given may have been planted there:
//
// Writing (the JSON report, heapfiles, metrics): the final name is never
// followed when it is a symbolic link and never opened when it is a FIFO,
// a device, a socket or a directory. The contents go to a new file made
// with O_EXCL next to the final name and are renamed over it, so a reader
// sees the old file or the whole new one, and the new file is the caller's
// own (it never inherits another user's file, its links or set-id bits).
// Only when the directory cannot be written does the file change in place,
// and then only a regular file the caller owns.
//
// Reading (heapfiles): only regular files, up to a stated size; a FIFO or
// a device is refused before it is opened, so it can neither block the run
// nor act on being opened.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace vs {

// Why a file could not be written or read: the errno and a printable
// reason that names the file.
struct FileFailure {
    int error = 0;
    std::string reason;
};

// Writes `contents` as the file `path` under the rules above. A new file
// gets `mode` (less the umask); a file the caller owns keeps its permission
// bits, never its set-id bits. Returns nullopt on success.
std::optional<FileFailure> writeOutputFile(const std::string &path, std::string_view contents,
                                           unsigned mode);

// Reads the regular file `path` (symbolic links followed) whole. Fails for
// anything else, and for files larger than `maxBytes`.
std::optional<std::string> readRegularFile(const std::string &path, uint64_t maxBytes,
                                           FileFailure &failure);

} // namespace vs
