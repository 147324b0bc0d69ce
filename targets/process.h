#pragma once

// The base of every analysed target: a live process, the kernel, a crash
// snapshot or a heapfile. It holds what all of them have (pid, name, label,
// page size, pointer width, idle-exit state, regions, errors, warnings),
// builds targets from the kernel's per-process record, resolves what the
// user typed into pids, and keeps the run-wide list of global errors.
//
// Construction is two-phase. The hooks a target runs while it is being set
// up (_populateTask, _gatherPageSize, ...) are virtual, and C++ does not
// dispatch to a subclass from inside a constructor, so a constructor only
// sets defaults and initWithBsdInfo() does the work. Use the factories
// (processWithPid, processWithBsdInfo, and the subclasses' own); they
// return null when the target cannot be set up.
//
// Threads: targets are built and the class operations run on the main
// thread; gatherData() runs once per target on one worker, which alone
// writes that target's regions, errors and warnings. Readers on the main
// thread look only after the gathering has been joined, so the accessors
// carry no locks of their own.

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "model/aux_data.h"
#include "model/memory_region.h"
#include "targets/platform/platform.h"

class VSProcess;

// Idle-exit state of a target.
enum VSIdleExitStatus : int32_t {
    VSIdleExitUnknown = 0,      // not determined (heapfiles never determine it)
    VSIdleExitUnsupported = 1,  // takes no part in idle exit, or the kernel
    VSIdleExitClean = 2,        // supports idle exit and is clean: -s drops it
    VSIdleExitDirty = 3,        // supports idle exit and is dirty
};

// A target's regions in address order; the target owns them.
using VSMemoryRegionList = std::vector<std::unique_ptr<VSMemoryRegion>>;

// Pid -> how the user named it: the matched process name, or nullopt when
// the pid was given (or found) as a number.
using VSPidTable = std::map<int32_t, std::optional<std::string>>;

// Targets keyed by a number. Live and corpse targets are keyed by pid;
// callers that key other targets (heapfiles) keep their keys outside the
// signed 32-bit range so that they never meet a pid.
using VSTargetMap = std::map<int64_t, std::unique_ptr<VSProcess>>;

class VSProcess {
public:
    VSProcess();
    virtual ~VSProcess();
    VSProcess(const VSProcess &) = delete;
    VSProcess &operator=(const VSProcess &) = delete;

    // ---- making targets ----------------------------------------------------
    // A VSKernelProcess for the kernel's record (system flag set), a
    // VSUserProcess otherwise; null when the target cannot be opened (a
    // live process whose task is refused has already recorded a global
    // error).
    static std::unique_ptr<VSProcess> processWithBsdInfo(const VSBsdInfo &info);
    // Fetches the pid's record first; null without any message when the pid
    // has no record (no such process, or no permission).
    static std::unique_ptr<VSProcess> processWithPid(int32_t pid);

    // ---- target discovery (one process-list snapshot per call) -----------
    // Every process except those in `excludedPids`, keyed by pid; processes
    // that cannot be opened are left out. nullopt when no process list
    // could be taken.
    static std::optional<VSTargetMap> allProcessesExcludingPids(const std::set<int32_t> &excludedPids);
    // Resolves each description as a process name (exact, first process in
    // the platform's order wins) or else as a decimal pid read the way a
    // number scanner reads it (" 42" and "42abc" are 42). A name match maps
    // the pid to the description, a pid match to nullopt. With `errors`
    // given, it receives one text per description that matched nothing, or
    // the single text for a missing process list. nullopt when no process
    // list could be taken.
    static std::optional<VSPidTable> pidsForStringDescriptions(const std::vector<std::string> &descriptions,
                                                               std::vector<std::string> *errors = nullptr);
    // The given pids followed by all their descendants, level by level.
    // A pid is never collected twice, which also ends the walk at the
    // kernel's record (pid 0 is its own parent). nullopt when no process
    // list could be taken.
    static std::optional<std::vector<int32_t>> childPidsForPids(const std::vector<int32_t> &pids);
    // The targets of `processes` whose idle-exit state is not clean. The
    // map is taken over: the clean targets are destroyed.
    static VSTargetMap removeIdleExitCleanProcessesFrom(VSTargetMap processes);

    // ---- global errors (problems tied to no gathered target) --------------
    // Main thread only.
    static void _addGlobalError(std::string error);
    static void _clearGlobalErrors();
    // A copy of the list; empty when nothing was ever added.
    static std::vector<std::string> globalErrors();
    // Notes on how the figures were obtained, tied to no target; unlike
    // errors they leave the summary valid. Main thread only.
    static void _addGlobalNote(std::string note);
    // Memory resident in processes that were to be read but could not be
    // (no right to open them): the report says how much it left out.
    static void _addUncountedResident(uint64_t bytes);
    static std::pair<uint64_t, uint32_t> uncountedResident(); // bytes, processes
    static std::vector<std::string> globalNotes();

    // ---- names ---------------------------------------------------------------
    // The record's own name: the 32-byte name field, else the 16-byte
    // command name, else "Unknown".
    static std::string _nameForBsdInfoCommName(const VSBsdInfo &info);
    // The last path component of the executable path in the process's
    // argument area; the record's own name when that cannot be read.
    static std::string _nameForBsdInfo(const VSBsdInfo &info);

    // ---- properties ------------------------------------------------------------
    int32_t pid() const { return _pid; }
    void setPid(int32_t pid) { _pid = pid; }
    const std::string &name() const { return _name; }
    void setName(std::string name) { _name = std::move(name); }
    // The label every report uses: "name [pid]" (plus a suffix for corpses
    // and heapfiles).
    const std::string &displayString() const { return _displayString; }
    void setDisplayString(std::string displayString) { _displayString = std::move(displayString); }
    bool is64bit() const { return _is64bit; }
    void setIs64bit(bool is64bit) { _is64bit = is64bit; }
    uint64_t pageSize() const { return _pageSize; }
    void setPageSize(uint64_t pageSize) { _pageSize = pageSize; }
    int32_t idleExitStatus() const { return _idleExitStatus; }

    // The regions in address order, set once when gathering ends. Empty
    // (and hasMemoryRegions() false) until then; a target whose gathering
    // was skipped keeps none. The driver attaches memory objects to the
    // regions through the pointers.
    bool hasMemoryRegions() const { return _hasMemoryRegions; }
    const VSMemoryRegionList &memoryRegions() const { return _memoryRegions; }
    void setMemoryRegions(VSMemoryRegionList regions);

    // A snapshot of the errors: later additions do not change it.
    std::vector<std::string> errors() const { return _errors; }
    const std::vector<std::string> &warnings() const { return _warnings; }

    // The pid as a 64-bit number, the key of the sharing analysis.
    int64_t asNumber() const { return _pid; }
    // Targets are equal and hashed by pid, whatever their kind.
    uint64_t hash() const { return static_cast<uint64_t>(static_cast<int64_t>(_pid)); }
    bool isEqual(const VSProcess &other) const { return other._pid == _pid; }

    // ---- hooks -------------------------------------------------------------------
    // Reads the target's images and regions (sets memoryRegions). Runs once,
    // on a worker thread. The base does nothing.
    virtual void gatherData();
    // Runs on a worker before any target gathers; true when gatherData must
    // wait until every target is prepared (the pages it shares with other
    // targets are known only then). The base needs no preparation.
    virtual bool prepareGatherData();
    // The target's auxiliary data, or null when it has none. The base
    // returns an empty dictionary.
    virtual std::shared_ptr<const VSAuxDataDictionary> auxData() const;
    // True while the target is a running process whose live state can still
    // be asked for.
    virtual bool _isAlive() const;
    // Whether the physical-vestage breakdown is on for this target; the
    // base reads the run-wide switch
    // (vs::readBreakDownPhysVestageSetting).
    virtual bool breakDownPhysVestage() const;

protected:
    // The designated set-up from a kernel record: pid, pointer width,
    // _populateTask, name, display string, page size. False (and the target
    // must be discarded) when _populateTask fails. Subclasses that need
    // state before _populateTask runs set it before calling this.
    virtual bool initWithBsdInfo(const VSBsdInfo &info);
    // Bytes per page of this target: the kernel's page size.
    virtual uint64_t _gatherPageSize();
    // Opens whatever the target needs for reading its memory. The base
    // cannot read anything and returns false.
    virtual bool _populateTask();

    void _addError(std::string error) { _errors.push_back(std::move(error)); }
    void _addWarning(std::string warning) { _warnings.push_back(std::move(warning)); }
    void _setIdleExitStatus(int32_t status) { _idleExitStatus = status; }

private:
    std::vector<std::string> _errors;
    std::vector<std::string> _warnings;
    int32_t _idleExitStatus = VSIdleExitUnknown;
    bool _is64bit = false;
    std::string _displayString;
    int32_t _pid = 0;
    std::string _name;
    VSMemoryRegionList _memoryRegions;
    bool _hasMemoryRegions = false;
    uint64_t _pageSize = 0;
};

namespace vs {

// The run-wide physical-vestage breakdown switch, the kernel setting
// "vm.self_region_vestage", read through the platform on every call (it is
// never cached). A failure other than a missing setting writes the
// perror-style line "Unable to retrieve status of physical vestage data
// collection: <reason>" to standard error and reads as false; a missing
// setting reads as false. The driver's class-wide switch answers with this.
bool readBreakDownPhysVestageSetting();
// The switch as this program keeps it where the kernel has no such setting.
void setProgramBreakDownFlag(bool enabled);

}  // namespace vs
