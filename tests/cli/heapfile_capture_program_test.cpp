// The capture program as a user runs it: what it writes, what it prints,
// and how it ends for processes it cannot read and files it cannot write.

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "targets/heapfile_process.h"
#include "tests/support/run_program.h"
#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

const std::string kCapture = VESTAGE_TEST_BIN_DIR "/vestage-capture";

class CaptureProgramTest : public vs::testing::TargetTest {};

TEST_F(CaptureProgramTest, WritesOneHeapfilePerProcessAndNamesEveryFailure) {
    if (!std::filesystem::exists(kCapture)) {
        GTEST_SKIP() << "vestage-capture is not built";
    }
    vs::test::MemChild child({"anon:private:8:8"});
    ASSERT_TRUE(child.ready());
    vs::testing::ScratchFile scratch("");
    const std::string directory = scratch.directory();
    const std::string pid = std::to_string(child.pid());
    const std::string written = directory + "/vs_memchild-" + pid + ".heap";
    const std::string absent = "2147483647";  // above any pid_max

    struct Case {
        const char *what;
        std::vector<std::string> arguments;
        int status;
        std::string out;
        std::string err;  // the start of standard error
    };
    const std::vector<Case> cases = {
        {"a readable process", {"-o", directory, pid}, 0, written + "\n", ""},
        {"one unreadable pid does not stop the others",
         {"-o", directory, absent, pid},
         1,
         written + "\n",
         "vestage-capture: cannot capture process " + absent + ": no such process, or not permitted to see it\n"},
        {"not a pid", {"-o", directory, "12abc"}, 1, "", "vestage-capture: 12abc: not a process id\n"},
        {"a directory that does not exist",
         {"-o", directory + "/missing", pid},
         1,
         "",
         "vestage-capture: cannot write heapfile of process " + pid + ": cannot create " + directory +
             "/missing/vs_memchild-" + pid + ".heap.tmp"},
        {"no process", {}, 1, "", "vestage-capture: no process given\n"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const vs::test::RunResult run = vs::test::runProgram(c.arguments, {}, kCapture);
        EXPECT_EQ(run.status, c.status) << run.err;
        EXPECT_EQ(run.out, c.out);
        EXPECT_EQ(run.err.substr(0, c.err.size()), c.err);
    }

    vs::HeapfileError error;
    auto heapfile = VSHeapfileProcess::processWithHeapfile(written, &error);
    ASSERT_NE(heapfile, nullptr) << error.description;
    EXPECT_EQ(heapfile->pid(), child.pid());
    EXPECT_EQ(heapfile->name(), "vs_memchild");
    // No temporary file is left beside the heapfile.
    size_t entries = 0;
    for (const auto &entry : std::filesystem::directory_iterator(directory)) {
        EXPECT_EQ(entry.path().extension(), ".heap") << entry.path();
        ++entries;
    }
    EXPECT_EQ(entries, 2u);  // the heapfile and the scratch file
}

}  // namespace
