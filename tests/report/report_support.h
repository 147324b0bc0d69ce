#pragma once

// Targets that hand over prepared regions when gathered, and a driver run
// over them, so a test states exactly the figures the report sees.

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "analysis/vestage.h"
#include "output/text_formatter.h"
#include "targets/platform/testing/fake_platform.h"

namespace report_test {

inline constexpr std::uint64_t KiB = 1024;
inline constexpr std::uint64_t MiB = 1024 * KiB;

struct RegionSpec {
    std::string name = "";
    std::uint64_t objectId = 0;
    std::uint64_t start = 0;  // 0: the next free 16 MiB slot
    std::uint64_t size = 16 * MiB;
    std::uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0, wired = 0;
    VSSegmentKind segment = VSSegmentNone;
    std::uint8_t shareMode = vs::kShareModePrivate;
    std::uint64_t offset = 0;
    bool inSharedCache = false, purgeableNonVolatile = false;
};

class PreparedProcess : public VSProcess {
public:
    PreparedProcess(std::int32_t pid, const std::string &name, std::uint64_t pageSize, bool is64) {
        setPid(pid), setName(name), setDisplayString(name + " [" + std::to_string(pid) + "]");
        setPageSize(pageSize), setIs64bit(is64);
    }

    PreparedProcess &region(const RegionSpec &s) {
        auto r = std::make_unique<VSMemoryRegion>();
        r->setName(s.name), r->setObject_id(s.objectId), r->setSize(s.size);
        r->setStart(s.start != 0 ? s.start : 16 * MiB * (_prepared.size() + 1));
        r->setDirtySize(s.dirty), r->setSwappedSize(s.swapped), r->setCleanNonSpecSize(s.clean);
        r->setReclaimableSize(s.reclaimable), r->setWiredSize(s.wired);
        r->setSegment(s.segment), r->setShare_mode(s.shareMode), r->setOffset(s.offset);
        r->setInSharedCache(s.inSharedCache), r->setPurgeableNonVolatile(s.purgeableNonVolatile);
        _prepared.push_back(std::move(r));
        return *this;
    }
    PreparedProcess &error(const std::string &text) { return _addError(text), *this; }
    PreparedProcess &warning(const std::string &text) { return _addWarning(text), *this; }
    PreparedProcess &aux(std::shared_ptr<const VSAuxDataDictionary> data) { return _aux = std::move(data), *this; }
    // Runs inside the target's gathering, on its worker.
    PreparedProcess &onGather(std::function<void()> action) { return _onGather = std::move(action), *this; }

    void gatherData() override {
        if (_onGather) {
            _onGather();
        }
        setMemoryRegions(std::move(_prepared));
    }
    std::shared_ptr<const VSAuxDataDictionary> auxData() const override { return _aux; }

private:
    VSMemoryRegionList _prepared;
    std::shared_ptr<const VSAuxDataDictionary> _aux;
    std::function<void()> _onGather;
};

// With one gathering worker the start order of the targets is observable.
class TestVestage : public VSVestage {
public:
    using VSVestage::VSVestage;
    using VSVestage::_setGatherWidth;
};

// One run over prepared targets with the test double as platform (the
// breakdown switch is one of its settings).
class ReportRun {
public:
    ReportRun() : _installed(fake.install()) { VSProcess::_clearGlobalErrors(); }
    ~ReportRun() { VSProcess::_clearGlobalErrors(); }

    PreparedProcess &process(std::int32_t pid, const std::string &name, std::uint64_t pageSize = 16384,
                             bool is64 = true) {
        _targets.push_back(std::make_unique<PreparedProcess>(pid, name, pageSize, is64));
        return static_cast<PreparedProcess &>(*_targets.back());
    }
    TestVestage &gather(unsigned width = 0) {
        vestage = std::make_unique<TestVestage>(std::move(_targets));
        vestage->_setGatherWidth(width);
        vestage->gatherData();
        return *vestage;
    }
    // Gathers unless done already; the text report as printed to standard
    // output (where the breakdown note goes too), after any `more` formatters.
    std::string report(std::int64_t format = VSSummaryFormatFormatted, std::int64_t options = 0,
                       std::unique_ptr<VSOutputFormatter> more = nullptr, bool summarize = false) {
        if (!vestage) {
            gather();
        }
        vestage->addOutputFormatter(std::make_unique<VSOutputFormatterText>(format, options));
        if (more) {
            vestage->addOutputFormatter(std::move(more));
        }
        testing::internal::CaptureStdout();
        vestage->printOutputVerbose(false, summarize);
        return testing::internal::GetCapturedStdout();
    }

    VSFakePlatform fake;
    std::unique_ptr<TestVestage> vestage;

private:
    std::unique_ptr<VSFakePlatform::Installation> _installed;
    std::vector<std::unique_ptr<VSProcess>> _targets;
};

inline std::string rule(std::size_t width = 70) { return std::string(width, '=') + "\n"; }

// MALLOC_SMALL: 8 MiB dirty and 1 MiB swapped in two regions; stack: 64 KiB
// dirty, 16 KiB clean and 16 KiB wired in three; 16 KiB pages.
inline PreparedProcess &addDaemon(ReportRun &run) {
    return run.process(42, "daemon")
        .region({.name = "MALLOC_SMALL", .objectId = 1, .dirty = 4 * MiB, .swapped = 512 * KiB})
        .region({.name = "MALLOC_SMALL", .objectId = 2, .dirty = 4 * MiB, .swapped = 512 * KiB})
        .region({.name = "stack", .objectId = 3, .dirty = 64 * KiB})
        .region({.name = "stack", .objectId = 4, .clean = 16 * KiB, .wired = 16 * KiB})
        .region({.name = "stack", .objectId = 5});
}

inline const std::string kDaemonFormatted = rule() +
                                            "daemon [42]: 64-bit\tVestage: 9280 KB (16384 bytes per page)\n" +
                                            rule() +
                                            "\n"
                                            "  Dirty      Clean  Reclaimable    Regions    Category\n"
                                            "    ---        ---          ---        ---    ---\n"
                                            "9216 KB        0 B          0 B          2    MALLOC_SMALL\n"
                                            "  64 KB      16 KB          0 B          3    stack\n"
                                            "    ---        ---          ---        ---    ---\n"
                                            "9280 KB      16 KB          0 B          5    TOTAL\n"
                                            "\n";

// The daemon with auxiliary data, a failed worker (its memory counts in the
// summary, its auxiliary data does not) and a warned 32-bit tool; the
// breakdown switch on.
inline void addTroubledRun(ReportRun &run) {
    using vs::makeAuxData, vs::makeAuxDictionary;
    run.fake.setting("vm.self_region_vestage", 1);
    addDaemon(run).aux(makeAuxDictionary({
        {"Kernel memory", makeAuxDictionary({{"KPRVT", makeAuxData(16384, true)},
                                             {"deeper", makeAuxDictionary({{"x", makeAuxData(0, true)}})}})},
        {"phys_vestage", makeAuxData(10000, false)},
    }));
    run.process(7, "worker")
        .region({.name = "MALLOC_SMALL", .objectId = 11, .dirty = 8 * MiB})
        .region({.name = "stack", .objectId = 13, .dirty = 64 * KiB})
        .region({.name = "stack", .objectId = 14, .clean = 16 * KiB})
        .aux(makeAuxDictionary({{"Kernel memory", makeAuxDictionary({{"KPRVT", makeAuxData(1 << 20, true)}})}}))
        .error("worker [7]: task is gone");
    run.process(5, "tool", 16384, false)
        .region({.name = "stack", .objectId = 21, .dirty = 16 * KiB})
        .warning("tool [5]: (zombie)");
}

} // namespace report_test
