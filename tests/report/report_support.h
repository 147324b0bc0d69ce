#pragma once

// Targets that hand over prepared regions when gathered, and a driver run
// that captures the text report, so a test states exactly the figures the
// analysis and the report see.

#include <cstdio>
#include <cstdlib>
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
    std::uint64_t dirty = 0;
    std::uint64_t swapped = 0;
    std::uint64_t clean = 0;
    std::uint64_t reclaimable = 0;
    std::uint64_t wired = 0;
    VSSegmentKind segment = VSSegmentNone;
    std::uint8_t shareMode = vs::kShareModePrivate;
    std::uint64_t offset = 0;
    bool inSharedCache = false;
    bool purgeableNonVolatile = false;
};

class PreparedProcess : public VSProcess {
public:
    PreparedProcess(std::int32_t pid, const std::string &name, std::uint64_t pageSize, bool is64) {
        setPid(pid);
        setName(name);
        setDisplayString(name + " [" + std::to_string(pid) + "]");
        setPageSize(pageSize);
        setIs64bit(is64);
    }

    PreparedProcess &region(const RegionSpec &shape) {
        auto r = std::make_unique<VSMemoryRegion>();
        r->setName(shape.name);
        r->setObject_id(shape.objectId);
        r->setStart(shape.start != 0 ? shape.start : 16 * MiB * (_prepared.size() + 1));
        r->setSize(16 * MiB);
        r->setDirtySize(shape.dirty);
        r->setSwappedSize(shape.swapped);
        r->setCleanNonSpecSize(shape.clean);
        r->setReclaimableSize(shape.reclaimable);
        r->setWiredSize(shape.wired);
        r->setSegment(shape.segment);
        r->setShare_mode(shape.shareMode);
        r->setOffset(shape.offset);
        r->setInSharedCache(shape.inSharedCache);
        r->setPurgeableNonVolatile(shape.purgeableNonVolatile);
        _prepared.push_back(std::move(r));
        return *this;
    }
    PreparedProcess &error(const std::string &text) { return _addError(text), *this; }
    PreparedProcess &warning(const std::string &text) { return _addWarning(text), *this; }
    PreparedProcess &aux(std::shared_ptr<const VSAuxDataDictionary> data) { return _aux = std::move(data), *this; }
    // Runs inside the target's gathering, on its worker.
    PreparedProcess &onGather(std::function<void()> action) { return _onGather = std::move(action), *this; }

    bool gathered() const { return _gathered; }
    void gatherData() override {
        _gathered = true;
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
    bool _gathered = false;
};

// Collects what is written to a stdio stream.
class CapturedStream {
public:
    CapturedStream() : _stream(open_memstream(&_buffer, &_length)) {}
    ~CapturedStream() {
        std::fclose(_stream);
        std::free(_buffer);
    }
    std::FILE *stream() const { return _stream; }
    std::string text() {
        std::fflush(_stream);
        return std::string(_buffer, _length);
    }

private:
    char *_buffer = nullptr;
    std::size_t _length = 0;
    std::FILE *_stream;
};

// Lets a test choose the number of gathering workers: with one, the start
// order of the targets is observable.
class TestVestage : public VSVestage {
public:
    using VSVestage::VSVestage;
    using VSVestage::_setGatherWidth;
};

// One run over prepared targets, with the test double as platform (the
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

    // The driver over the targets added so far, not yet gathered.
    TestVestage &build(unsigned width = 0) {
        vestage = std::make_unique<TestVestage>(std::move(_targets));
        vestage->_setGatherWidth(width);
        return *vestage;
    }
    TestVestage &gather(unsigned width = 0) {
        if (!vestage) {
            build(width);
        }
        vestage->gatherData();
        return *vestage;
    }
    // Gathers unless done already, then prints the whole text report.
    std::string report(std::int64_t format = VSSummaryFormatFormatted, std::int64_t options = 0) {
        if (!vestage) {
            gather();
        }
        auto text = std::make_unique<VSOutputFormatterText>(format, options);
        text->setOutput(_output.stream());
        vestage->addOutputFormatter(std::move(text));
        vestage->printOutputVerbose(false, false);
        return _output.text();
    }

    VSFakePlatform fake;
    std::unique_ptr<TestVestage> vestage;

private:
    std::unique_ptr<VSFakePlatform::Installation> _installed;
    std::vector<std::unique_ptr<VSProcess>> _targets;
    CapturedStream _output;
};

inline std::string rule(std::size_t width = 70) { return std::string(width, '=') + "\n"; }

} // namespace report_test
