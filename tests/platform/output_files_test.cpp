// Output files under names a local user may have planted: what root's run writes, refuses and leaves alone.

#include "targets/platform/files.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <set>
#include <sstream>

namespace {

namespace fs = std::filesystem;

constexpr uid_t kNobody = 65534;

struct ScratchDir {
    ScratchDir() {
        path = fs::temp_directory_path() / ("vestage-files-" + std::to_string(::getpid()));
        fs::remove_all(path);
        fs::create_directories(path);
    }
    ~ScratchDir() { fs::remove_all(path); }
    fs::path path;
};

std::string readFile(const fs::path &path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

void writeFile(const fs::path &path, const std::string &text) { std::ofstream(path, std::ios::binary) << text; }

std::set<std::string> entriesOf(const fs::path &directory) {
    std::set<std::string> names;
    for (const auto &entry : fs::directory_iterator(directory)) {
        names.insert(entry.path().filename());
    }
    return names;
}

struct stat statOf(const fs::path &path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st;
}

// Root writing into a directory where someone planted something at the final name: a link is never followed (not
// even a dangling one, which would create a file elsewhere), a FIFO is never opened (it would block, or hand the
// report to the planter), another user's file is replaced by root's own, without its set-id bits or its other links.
TEST(OutputFiles, PlantedFinalNames) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs root to plant files of another user";
    }
    struct Case {
        const char *label;
        std::function<void(const fs::path &dir)> plant;  // at dir/"out.json"
        const char *failure;                              // the reason's tail, or null when written
        std::function<void(const fs::path &dir)> check;
    };
    const std::vector<Case> cases = {
        {"nothing there: a new file, mode 0644 less the umask, no temporary left", [](const fs::path &) {}, nullptr,
         [](const fs::path &dir) {
             EXPECT_EQ(statOf(dir / "out.json").st_mode & 07777, 0644u);
             EXPECT_EQ(entriesOf(dir), std::set<std::string>{"out.json"});
         }},
        {"link to a secret", [](const fs::path &dir) {
             writeFile(dir / "secret", "root only");
             fs::permissions(dir / "secret", fs::perms(0600));
             fs::create_symlink(dir / "secret", dir / "out.json");
         },
         "is a symbolic link; vestage writes only regular files and never follows a link there",
         [](const fs::path &dir) {
             EXPECT_EQ(readFile(dir / "secret"), "root only");
             EXPECT_TRUE(fs::is_symlink(fs::symlink_status(dir / "out.json")));
         }},
        {"dangling link", [](const fs::path &dir) { fs::create_symlink(dir / "created", dir / "out.json"); },
         "is a symbolic link; vestage writes only regular files and never follows a link there",
         [](const fs::path &dir) { EXPECT_FALSE(fs::exists(dir / "created")); }},
        {"FIFO", [](const fs::path &dir) { ASSERT_EQ(::mkfifo((dir / "out.json").c_str(), 0666), 0); },
         "is a FIFO; vestage writes only regular files and never follows a link there",
         [](const fs::path &dir) { EXPECT_TRUE(S_ISFIFO(statOf(dir / "out.json").st_mode)); }},
        {"directory", [](const fs::path &dir) { fs::create_directory(dir / "out.json"); },
         "is a directory; vestage writes only regular files and never follows a link there",
         [](const fs::path &) {}},
        {"another user's set-id file, hard-linked to a second name", [](const fs::path &dir) {
             writeFile(dir / "out.json", "planted");
             ASSERT_EQ(::chown((dir / "out.json").c_str(), kNobody, kNobody), 0);
             ASSERT_EQ(::chmod((dir / "out.json").c_str(), 06777), 0);
             fs::create_hard_link(dir / "out.json", dir / "other-name");
         },
         nullptr,
         [](const fs::path &dir) {
             const struct stat st = statOf(dir / "out.json");
             EXPECT_EQ(st.st_uid, 0u);
             EXPECT_EQ(st.st_mode & 07777, 0644u);
             EXPECT_EQ(st.st_nlink, 1u);
             EXPECT_EQ(readFile(dir / "other-name"), "planted");
         }},
        {"the caller's own file keeps its permissions", [](const fs::path &dir) {
             writeFile(dir / "out.json", std::string(100000, 'x'));
             fs::permissions(dir / "out.json", fs::perms(0640));
         },
         nullptr, [](const fs::path &dir) { EXPECT_EQ(statOf(dir / "out.json").st_mode & 07777, 0640u); }},
    };
    const mode_t oldMask = ::umask(022);
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ScratchDir dir;
        c.plant(dir.path);
        const auto failure = vs::writeOutputFile((dir.path / "out.json").string(), "{}", 0644);
        if (c.failure != nullptr) {
            EXPECT_EQ(failure.value_or(vs::FileFailure{0, "written"}).reason,
                      (dir.path / "out.json").string() + " " + c.failure);
        } else {
            EXPECT_EQ(failure.value_or(vs::FileFailure{0, "written"}).reason, "written");
            EXPECT_EQ(readFile(dir.path / "out.json"), "{}");
        }
        c.check(dir.path);
    }
    ::umask(oldMask);
}

// A directory the caller cannot write takes no temporary file: the caller's own file there is written in place,
// anyone else's is left alone. Run by a child that drops root, reporting through its exit status.
TEST(OutputFiles, DirectoryTheCallerCannotWrite) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs root to make the directory unwritable for the writer";
    }
    ScratchDir dir;
    writeFile(dir.path / "mine.json", "previous");
    writeFile(dir.path / "theirs.json", "previous");
    ASSERT_EQ(::chown((dir.path / "mine.json").c_str(), kNobody, kNobody), 0);
    fs::permissions(dir.path / "theirs.json", fs::perms(0666));  // writable, yet not the caller's
    const pid_t child = ::fork();
    if (child == 0) {
        if (::setgid(kNobody) != 0 || ::setuid(kNobody) != 0) {
            ::_exit(8);
        }
        const auto mine = vs::writeOutputFile((dir.path / "mine.json").string(), "new", 0644);
        const auto theirs = vs::writeOutputFile((dir.path / "theirs.json").string(), "new", 0644);
        const auto fresh = vs::writeOutputFile((dir.path / "fresh.json").string(), "new", 0644);
        ::_exit((mine ? 1 : 0) |
                (theirs && theirs->reason == (dir.path / "theirs.json").string() +
                                                    " belongs to another user and its directory is not "
                                                    "writable; not replaced"
                     ? 0
                     : 2) |
                (fresh && fresh->error == EACCES ? 0 : 4));
    }
    int status = -1;
    ::waitpid(child, &status, 0);
    EXPECT_EQ(status, 0) << "exit status bits: 1 own file not written, 2 other's file not refused, 4 new file";
    EXPECT_EQ(readFile(dir.path / "mine.json"), "new");
    EXPECT_EQ(readFile(dir.path / "theirs.json"), "previous");
    EXPECT_EQ(entriesOf(dir.path), (std::set<std::string>{"mine.json", "theirs.json"}));
}

} // namespace
