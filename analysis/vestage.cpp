#include "analysis/vestage.h"

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <initializer_list>
#include <mutex>
#include <unordered_set>

#include "analysis/work_queue.h"
#include "model/memory_category.h"

namespace {

constexpr const char *kGatherQueueLabel = "org.vestage.gatherdata";
constexpr const char *kBreakDownSetting = "vm.self_region_vestage";
constexpr const char *kSharingUnresolvedNote =
    "Pages shared after fork could not be told apart without the right to read page frames (run as root): "
    "each process counts them as its own";
constexpr const char *kEarlyExitError = "Vestage exited early due to SIGINT and did not finish gathering all data";
constexpr std::uint64_t kFoldLimit = 1048576;

void reportSystemError(const char *text, int32_t error) {
    std::fprintf(stderr, "%s: %s\n", text, std::strerror(error));
}

bool isImageSegment(VSSegmentKind segment) {
    return segment == VSSegmentText || segment == VSSegmentData || segment == VSSegmentLinkedit;
}

// Small or image-segment categories that only clutter a summarized table.
// Purgeable non-volatile memory with clean pages stays visible: it is
// memory the program chose to keep.
bool isFoldable(const VSMemoryCategory &category) {
    const std::uint64_t dirty = category.totalDirtySize() + category.totalSwappedSize();
    if (!isImageSegment(category.segment()) && dirty != 0) {
        return false;
    }
    if (dirty > kFoldLimit) {
        return false;
    }
    return !(category.purgeableNonVolatile() && category.totalCleanSize() != 0);
}

void addToTotals(VSCategoryTotals &totals, const VSMemoryCategory &category) {
    totals.dirty += category.totalDirtySize();
    totals.swapped += category.totalSwappedSize();
    totals.clean += category.totalCleanSize();
    totals.reclaimable += category.totalReclaimableSize();
    totals.wired += category.totalWiredSize();
    totals.regions += static_cast<std::uint32_t>(category.totalRegions());
}

} // namespace

VSVestage::VSVestage(std::vector<std::unique_ptr<VSProcess>> processes) : _processes(std::move(processes)) {}

VSVestage::~VSVestage() = default;

void VSVestage::addOutputFormatter(std::unique_ptr<VSOutputFormatter> formatter) {
    _outputFormatters.push_back(std::move(formatter));
}

// ---- gathering ------------------------------------------------------------------

void VSVestage::gatherData() {
    vs::WorkQueue queue(kGatherQueueLabel, _gatherWidth);
    const std::vector<VSProcess *> order = _getProcessListSortedByPidDesc();
    // Targets that share pages with others are walked only once every
    // target has been looked at; the rest gather at once.
    std::mutex waitingMutex;
    std::vector<VSProcess *> waiting;
    queue.parallel_for(order.size(), [&](std::size_t index) {
        if (_earlyExit.load()) {
            return;
        }
        if (order[index]->prepareGatherData()) {
            std::lock_guard<std::mutex> lock(waitingMutex);
            waiting.push_back(order[index]);
        } else {
            order[index]->gatherData();
        }
    });
    if (!waiting.empty()) {
        if (!VSPlatform::current().resolve_shared_pages()) {
            VSProcess::_addGlobalNote(kSharingUnresolvedNote);
        }
        // Keep the walks in pid order, as the other targets were.
        std::sort(waiting.begin(), waiting.end(), [](const VSProcess *a, const VSProcess *b) { return a->pid() > b->pid(); });
        queue.parallel_for(waiting.size(), [&](std::size_t index) {
            if (!_earlyExit.load()) {
                waiting[index]->gatherData();
            }
        });
    }
    if (const auto [bytes, processes] = VSProcess::uncountedResident(); processes != 0) {
        char text[160];
        std::snprintf(text, sizeof text, "Not counted: %.1f MiB (%llu bytes) resident in %u %s that could not be read",
                      static_cast<double>(bytes) / (1 << 20), static_cast<unsigned long long>(bytes), processes,
                      processes == 1 ? "process" : "processes");
        VSProcess::_addGlobalNote(text);
    }
    if (_earlyExit.load()) {
        VSProcess::_addGlobalError(kEarlyExitError);
    }
    // Most regions get an object of their own: make room for all at once.
    std::size_t regionCount = 0;
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        regionCount += process->memoryRegions().size();
    }
    _memoryObjects.reserve(regionCount);
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        _addProcess(*process);
    }
    _filedInProcessOrder = true;
    // Filing is done: the indexes of the collections are not needed while
    // the report holds everything else.
    for (MemoryObjectTable *table : {&_memoryObjects, &_kernelMemoryObjects, &_sharedCache64MemoryObjects,
                                     &_sharedCache32MemoryObjects, &_textMemoryObjects, &_linkeditMemoryObjects}) {
        table->dropIndex();
    }
    calculateSizes();
    _buildProcessToVestageMap();
}

void VSVestage::_addProcess(VSProcess &process) {
    _filedInProcessOrder = false;
    for (const std::unique_ptr<VSMemoryRegion> &owned : process.memoryRegions()) {
        VSMemoryRegion &region = *owned;
        std::uint64_t key;
        MemoryObjectTable *table;
        if (region.inSharedCache()) {
            key = region.start();
            table = process.is64bit() ? &_sharedCache64MemoryObjects : &_sharedCache32MemoryObjects;
        } else {
            key = region.object_id();
            switch (region.segment()) {
            case VSSegmentText:
                table = &_textMemoryObjects;
                break;
            case VSSegmentLinkedit:
                table = &_linkeditMemoryObjects;
                break;
            default:
                // The kernel's made-up object ids could meet the private keys
                // of copy-on-write regions (a pid in the upper half), so its
                // objects are keyed apart from every process's.
                table = process.pid() == 0 ? &_kernelMemoryObjects : &_memoryObjects;
                break;
            }
        }
        if (region.share_mode() == vs::kShareModeCopyOnWrite &&
            (region.dirtySize() != 0 || region.swappedSize() != 0)) {
            key ^= static_cast<std::uint64_t>(static_cast<std::uint32_t>(process.pid())) << 32;
        }
        VSMemoryObject *object;
        if (key != 0) {
            object = &table->objectFor(key);
        } else {
            _uniqueMemoryObjects.push_back(std::make_unique<VSMemoryObject>());
            object = _uniqueMemoryObjects.back().get();
        }
        object->addRegion(&region, process.pageSize());
        region.setMemoryObject(object);
    }
}

void VSVestage::calculateSizes() {
    for (const MemoryObjectTable *table :
         {&_memoryObjects, &_kernelMemoryObjects, &_sharedCache32MemoryObjects, &_sharedCache64MemoryObjects}) {
        for (const std::unique_ptr<VSMemoryObject> &object : table->objects()) {
            object->calculateSizes();
        }
    }
    for (const std::unique_ptr<VSMemoryObject> &object : _uniqueMemoryObjects) {
        object->calculateSizes();
    }
    for (const MemoryObjectTable *table : {&_textMemoryObjects, &_linkeditMemoryObjects}) {
        for (const std::unique_ptr<VSMemoryObject> &object : table->objects()) {
            object->calculateSizes();
        }
    }
}

// ---- interrupt and breakdown switch ---------------------------------------------

std::unique_ptr<vs::InterruptSource> VSVestage::installCancelHandler(std::function<void()> callback) {
    if (vs::standardOutputIsTerminal()) {
        return nullptr;
    }
    return std::make_unique<vs::InterruptSource>(std::move(callback));
}

// The targets read the same setting through the process layer, which does
// the reading for both.
bool VSVestage::breakDownPhysVestage() { return vs::readBreakDownPhysVestageSetting(); }

void VSVestage::setBreakDownPhysVestage(bool enabled) {
    vs::setProgramBreakDownFlag(enabled);
    const std::int32_t error = VSPlatform::current().sysctl_by_name_write(kBreakDownSetting, enabled ? 1 : 0);
    if (error != 0 && error != ENOENT) {
        reportSystemError("Unable to configure physical vestage data collection", error);
    }
}

// ---- categories -------------------------------------------------------------------

namespace {

// The category of a name in a table being built. Names are the run's shared
// strings, so each distinct one is looked up by text once; every later
// object with it finds its category by the string's address.
class CategoryFinder {
public:
    explicit CategoryFinder(VSCategoryTable &table) : _table(table) {}

    VSMemoryCategory &categoryFor(const std::string *name, VSSegmentKind segment) {
        auto [cached, added] = _byName.try_emplace(name, nullptr);
        if (added) {
            const std::string text = name != nullptr ? *name : std::string();
            auto found = _table.find(text);
            if (found == _table.end()) {
                found = _table.emplace(text, VSMemoryCategory(text, segment)).first;
            }
            cached->second = &found->second;
        }
        return *cached->second;
    }

private:
    VSCategoryTable &_table;
    std::unordered_map<const std::string *, VSMemoryCategory *> _byName;
};

} // namespace

VSCategoryTable VSVestage::_categoriesForAllProcesses() const {
    VSCategoryTable table;
    CategoryFinder finder(table);
    // An object is placed at the first region met that maps it. When the
    // targets were filed in this same order that is the object's own first
    // region, and no set of placed objects is needed.
    vs::PointerSet<const VSMemoryObject> placed;
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        for (const std::unique_ptr<VSMemoryRegion> &region : process->memoryRegions()) {
            VSMemoryObject *object = region->memoryObject();
            if (object == nullptr) {
                continue;
            }
            const bool first = _filedInProcessOrder ? *object->memoryRegions().begin() == region.get()
                                                    : placed.insert(object);
            if (!first) {
                continue;
            }
            finder.categoryFor(region->sharedName(), region->segment()).addNewMemoryObject(object);
        }
    }
    return table;
}

// The objects are a group's set: distinct, so each is added without a lookup.
VSCategoryTable VSVestage::_categoriesForObjects(std::span<VSMemoryObject *const> objects) const {
    VSCategoryTable table;
    CategoryFinder finder(table);
    for (VSMemoryObject *object : objects) {
        const vs::RegionSet &regions = object->memoryRegions();
        const VSSegmentKind segment = regions.empty() ? VSSegmentUnknown : (*regions.begin())->segment();
        finder.categoryFor(object->sharedName(), segment).addNewMemoryObject(object);
    }
    return table;
}

VSCategoryTable VSVestage::_summarizedCategoriesForCategories(VSCategoryTable categories, bool summarize,
                                                              VSCategoryTotals &outTotal) {
    outTotal = VSCategoryTotals{};
    VSCategoryTable result;
    VSMemoryCategory other("Other", VSSegmentNone);
    for (auto &[name, category] : categories) {
        addToTotals(outTotal, category);
        if (summarize && isFoldable(category)) {
            for (VSMemoryObject *object : category.memoryObjects()) {
                other.addNewMemoryObject(object); // categories of one table share no object
            }
        } else {
            result.insert_or_assign(name, std::move(category));
        }
    }
    if (!other.memoryObjects().empty()) {
        result.insert_or_assign("Other", std::move(other));
    }
    return result;
}

VSSortedCategoryKeys VSVestage::_sortedKeysForCategories(const VSCategoryTable &categories) {
    // The entries are sorted, not their names: comparing through the table
    // would look both names up again for every comparison.
    std::vector<const VSCategoryTable::value_type *> entries;
    entries.reserve(categories.size());
    for (const auto &entry : categories) {
        entries.push_back(&entry);
    }
    // The table iterates in name order and the sort is stable, so equal
    // categories stay in name order.
    std::stable_sort(entries.begin(), entries.end(), [](const auto *a, const auto *b) {
        const VSMemoryCategory &x = a->second;
        const VSMemoryCategory &y = b->second;
        const std::uint64_t dirtyX = x.totalDirtySize() + x.totalSwappedSize();
        const std::uint64_t dirtyY = y.totalDirtySize() + y.totalSwappedSize();
        if (dirtyX != dirtyY) {
            return dirtyX > dirtyY;
        }
        if (x.totalReclaimableSize() != y.totalReclaimableSize()) {
            return x.totalReclaimableSize() > y.totalReclaimableSize();
        }
        return x.totalCleanSize() > y.totalCleanSize();
    });
    VSSortedCategoryKeys keys;
    keys.reserve(entries.size());
    for (const auto *entry : entries) {
        keys.push_back(entry->first);
    }
    return keys;
}

// ---- vestage and orderings ------------------------------------------------------------

std::uint64_t VSVestage::_calculateVestageForProcess(const VSProcess &process) const {
    std::uint64_t vestage = 0;
    vs::PointerSet<const VSMemoryObject> counted;
    counted.reserve(process.memoryRegions().size());
    for (const std::unique_ptr<VSMemoryRegion> &region : process.memoryRegions()) {
        const VSMemoryObject *object = region->memoryObject();
        if (object != nullptr && counted.insert(object)) {
            vestage += object->totalDirtySize() + object->totalSwappedSize();
        }
    }
    return vestage;
}

void VSVestage::_buildProcessToVestageMap() {
    _pidToVestage.clear();
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        _pidToVestage[process->pid()] = _calculateVestageForProcess(*process);
    }
}

std::vector<VSProcess *> VSVestage::_getProcessListSortedByPidDesc() const {
    std::vector<VSProcess *> list;
    list.reserve(_processes.size());
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        list.push_back(process.get());
    }
    std::stable_sort(list.begin(), list.end(),
                     [](const VSProcess *a, const VSProcess *b) { return a->pid() > b->pid(); });
    return list;
}

std::vector<VSProcess *> VSVestage::_getProcessListSortedByVestage() const {
    auto vestageOf = [this](const VSProcess *process) -> std::uint64_t {
        auto found = _pidToVestage.find(process->pid());
        return found == _pidToVestage.end() ? 0 : found->second;
    };
    std::vector<VSProcess *> list = _getProcessListSortedByPidDesc();
    std::stable_sort(list.begin(), list.end(),
                     [&](const VSProcess *a, const VSProcess *b) { return vestageOf(a) > vestageOf(b); });
    return list;
}

// ---- sharing ------------------------------------------------------------------------------

std::unique_ptr<VSVestageSharingData> VSVestage::_sharingData() const {
    // Phase one: the members of every object, objects in the order first
    // met. Most objects have one member, which is kept in place; the members
    // of the others go to a list of their own.
    struct Members {
        const VSProcess *first = nullptr;
        std::size_t more = 0; // 0, or 1 + the index of the object's list in `lists`
    };
    vs::PointerSet<VSMemoryObject> objects;
    std::vector<Members> membersOfObject;
    std::vector<VSProcessGroup> lists;
    // Room for every object (at most one per region) once, not by growing.
    std::size_t objectCount = _uniqueMemoryObjects.size();
    for (const MemoryObjectTable *table : {&_memoryObjects, &_kernelMemoryObjects, &_sharedCache64MemoryObjects,
                                           &_sharedCache32MemoryObjects, &_textMemoryObjects, &_linkeditMemoryObjects}) {
        objectCount += table->size();
    }
    if (objectCount == 0) {
        for (const std::unique_ptr<VSProcess> &process : _processes) {
            objectCount += process->memoryRegions().size();
        }
    }
    objects.reserve(objectCount);
    membersOfObject.reserve(objectCount);
    // With distinct pids (every live run) a target that is already a member
    // of a group was the last one added, since targets are visited one after
    // another: no search through the members is needed.
    std::unordered_set<std::int32_t> pids;
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        pids.insert(process->pid());
    }
    const bool distinctPids = pids.size() == _processes.size();
    for (const std::unique_ptr<VSProcess> &process : _processes) {
        const VSProcess *const target = process.get();
        const VSMemoryObject *lastObject = nullptr;
        for (const std::unique_ptr<VSMemoryRegion> &region : process->memoryRegions()) {
            VSMemoryObject *object = region->memoryObject();
            if (object == nullptr || object == lastObject) {
                continue; // the same object again: target already a member
            }
            lastObject = object;
            const auto [index, added] = objects.insertIndex(object);
            if (added) {
                membersOfObject.push_back({target, 0});
                continue;
            }
            Members &members = membersOfObject[index];
            const VSProcess *last = members.more == 0 ? members.first : lists[members.more - 1].back();
            // Members are distinct by pid; the first target with a pid stays.
            bool member = last == target;
            if (!member && !distinctPids) {
                member = members.first->pid() == target->pid();
                if (!member && members.more != 0) {
                    const VSProcessGroup &list = lists[members.more - 1];
                    member = std::any_of(list.begin(), list.end(),
                                         [&](const VSProcess *p) { return p->pid() == target->pid(); });
                }
            }
            if (member) {
                continue;
            }
            if (members.more == 0) {
                lists.push_back({members.first});
                members.more = lists.size();
            }
            lists[members.more - 1].push_back(target);
        }
    }

    // Phase two: objects by group, groups by target.
    VSVestageSharingData::ProcessGroupToObjects processGroupToObjects;
    auto objectsOfGroup = [&](const VSProcessGroup &group) -> vs::MemoryObjectSet & {
        return processGroupToObjects.try_emplace(group).first->second;
    };
    // A target's private group is looked up once, not once per object.
    std::unordered_map<const VSProcess *, vs::MemoryObjectSet *> privateObjects;
    for (std::size_t i = 0; i < membersOfObject.size(); ++i) {
        VSMemoryObject *object = objects.items()[i];
        const Members &members = membersOfObject[i];
        if (members.more == 0) {
            vs::MemoryObjectSet *&set = privateObjects[members.first];
            if (set == nullptr) {
                set = &objectsOfGroup(VSProcessGroup{members.first});
            }
            set->appendNew(object); // each object is visited once
            continue;
        }
        VSProcessGroup &group = lists[members.more - 1];
        std::stable_sort(group.begin(), group.end(),
                         [](const VSProcess *a, const VSProcess *b) { return a->pid() < b->pid(); });
        objectsOfGroup(group).appendNew(object);
    }
    // Visiting the groups in their order lists each target's in that order.
    VSVestageSharingData::ProcessToProcessGroups processToProcessGroups;
    for (const auto &entry : processGroupToObjects) {
        for (const VSProcess *member : entry.first) {
            processToProcessGroups[member->asNumber()].push_back(&entry);
        }
    }

    auto sharing = std::make_unique<VSVestageSharingData>();
    sharing->setProcessToProcessGroups(std::move(processToProcessGroups));
    sharing->setProcessGroupToObjects(std::move(processGroupToObjects));
    return sharing;
}

void VSVestage::_releaseMemoryObjectsTo(VSVestageSharingData &sharing) {
    // The ordinary collection holds nearly every object of a live run: its
    // list is handed over whole, with the others appended in one step.
    MemoryObjectList objects = _memoryObjects.release();
    const std::initializer_list<MemoryObjectTable *> tables = {&_kernelMemoryObjects, &_sharedCache64MemoryObjects,
                                                               &_sharedCache32MemoryObjects, &_textMemoryObjects,
                                                               &_linkeditMemoryObjects};
    std::size_t count = objects.size() + _uniqueMemoryObjects.size();
    for (const MemoryObjectTable *table : tables) {
        count += table->size();
    }
    objects.reserve(count);
    for (MemoryObjectTable *table : tables) {
        for (std::unique_ptr<VSMemoryObject> &object : table->release()) {
            objects.push_back(std::move(object));
        }
    }
    for (std::unique_ptr<VSMemoryObject> &object : _uniqueMemoryObjects) {
        objects.push_back(std::move(object));
    }
    _uniqueMemoryObjects.clear();
    sharing.adoptMemoryObjects(std::move(objects));
}

// ---- report --------------------------------------------------------------------------------

void VSVestage::printSpanlistLikeOutputForProcesses(const std::vector<const VSProcess *> &processes) {
    std::vector<VSOutputFormatter *> listers;
    for (const std::unique_ptr<VSOutputFormatter> &formatter : _outputFormatters) {
        if (formatter->implementsOperation(VSOptionalFormatterOperation::printSpanlistLikeOutputForProcess)) {
            listers.push_back(formatter.get());
        }
    }
    if (listers.empty()) {
        return;
    }
    for (const VSProcess *process : processes) {
        std::vector<const VSMemoryRegion *> regions;
        regions.reserve(process->memoryRegions().size());
        for (const std::unique_ptr<VSMemoryRegion> &region : process->memoryRegions()) {
            regions.push_back(region.get());
        }
        std::stable_sort(regions.begin(), regions.end(),
                         [](const VSMemoryRegion *a, const VSMemoryRegion *b) { return a->start() < b->start(); });
        for (VSOutputFormatter *formatter : listers) {
            formatter->printSpanlistLikeOutputForProcess(*process, regions);
        }
    }
}

void VSVestage::printOutputVerbose(bool verbose, bool summarize) {
    const std::vector<VSProcess *> sorted = _getProcessListSortedByVestage();
    const std::vector<const VSProcess *> processes(sorted.begin(), sorted.end());
    if (verbose) {
        printSpanlistLikeOutputForProcesses(processes);
    }

    // From here on the sharing record keeps the memory objects alive; the
    // collections are not needed again and their memory goes back before
    // printing starts.
    const std::unique_ptr<VSVestageSharingData> sharing = _sharingData();
    _releaseMemoryObjectsTo(*sharing);

    std::vector<const VSProcess *> processesWithWarnings;
    std::vector<const VSProcess *> processesWithErrors;
    std::shared_ptr<const VSAuxDataDictionary> mergedAuxData;
    VSCategoryTotals totals;
    struct GroupTable {
        VSCategoryTable categories;
        VSSortedCategoryKeys keys;
        VSCategoryTotals totals;
    };
    std::unordered_map<const vs::MemoryObjectSet *, std::unique_ptr<GroupTable>> groupTables;

    for (const VSProcess *process : processes) {
        const bool hasErrors = !process->errors().empty();
        if (!process->warnings().empty()) {
            processesWithWarnings.push_back(process);
        }
        const std::shared_ptr<const VSAuxDataDictionary> auxData = process->auxData();
        if (hasErrors) {
            processesWithErrors.push_back(process);
        } else if (auxData) {
            mergedAuxData = auxData->mergeWithData(mergedAuxData.get());
        }
        auto vestage = _pidToVestage.find(process->pid());
        const std::uint64_t total = vestage == _pidToVestage.end() ? 0 : vestage->second;

        for (const std::unique_ptr<VSOutputFormatter> &formatter : _outputFormatters) {
            formatter->printProcessHeader(*process);
            if (!hasErrors) {
                formatter->printProcessTotal(total, *process);
            }
            formatter->endProcessHeader(*process);
        }
        if (hasErrors) {
            continue;
        }

        // The memory the process alone maps first, then each group it
        // shares with, in group order.
        VSVestageSharingData::ProcessGroups groups;
        auto found = sharing->processToProcessGroups().find(process->asNumber());
        if (found != sharing->processToProcessGroups().end()) {
            for (const auto *entry : found->second) {
                if (entry->first.size() == 1) {
                    groups.insert(groups.begin(), entry);
                } else {
                    groups.push_back(entry);
                }
            }
        }
        for (const auto *entry : groups) {
            const VSProcessGroup *group = &entry->first;
            const vs::MemoryObjectSet &objects = entry->second;
            // A shared group's table is the same for every member that
            // prints it: build it once.
            std::unique_ptr<GroupTable> privateTable;
            std::unique_ptr<GroupTable> &table = group->size() == 1 ? privateTable : groupTables[&objects];
            if (!table) {
                table = std::make_unique<GroupTable>();
                table->categories = _summarizedCategoriesForCategories(_categoriesForObjects(objects.items()),
                                                                       summarize, table->totals);
                table->keys = _sortedKeysForCategories(table->categories);
            }
            for (const std::unique_ptr<VSOutputFormatter> &formatter : _outputFormatters) {
                if (group->size() == 1) {
                    formatter->printProcessCategories(table->categories, table->keys, table->totals);
                } else if (formatter->implementsOperation(VSOptionalFormatterOperation::printSharedCategories)) {
                    formatter->printSharedCategories(table->categories, table->keys, *group, *process,
                                                     table->totals);
                }
            }
        }
        for (const std::unique_ptr<VSOutputFormatter> &formatter : _outputFormatters) {
            formatter->printProcessAuxData(auxData.get());
        }
    }

    const std::vector<std::string> globalErrors = VSProcess::globalErrors();
    const std::vector<std::string> globalNotes = VSProcess::globalNotes();
    for (const std::unique_ptr<VSOutputFormatter> &formatter : _outputFormatters) {
        formatter->printProcessesWithWarnings(processesWithWarnings, processesWithErrors, globalErrors);
        formatter->printNotes(globalNotes);
    }

    const VSCategoryTable summary = _summarizedCategoriesForCategories(_categoriesForAllProcesses(), summarize, totals);
    const VSSortedCategoryKeys summaryKeys = _sortedKeysForCategories(summary);
    const bool hadErrors = !globalErrors.empty() || !processesWithErrors.empty();
    for (const std::unique_ptr<VSOutputFormatter> &formatter : _outputFormatters) {
        formatter->printSummaryCategories(summary, summaryKeys, totals, hadErrors);
        formatter->printGlobalAuxData(mergedAuxData.get());
        formatter->end();
    }
}
