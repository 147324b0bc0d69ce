#pragma once

// Who shares what. Every memory object is mapped by an exact set of
// targets, its process group; a group of one target holds that target's
// private memory. Targets are told apart by pid, as everywhere else: two
// targets with one pid (two heapfiles of the same process) are one member.
//
// A group is stored as its members in ascending pid order. Groups are
// ordered by size, then by their pid sequences, so a target's private
// memory comes first and its closest sharers next, and the order of groups
// and of the names on a "Shared with" line is the same in every run.

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <vector>

#include "model/memory_category.h"
#include "model/memory_object.h"

class VSProcess;

// The distinct targets of a group, ascending by pid, each pid once.
using VSProcessGroup = std::vector<const VSProcess *>;

namespace vs {

// Smaller groups first, then by pid sequence; groups with equal pids are
// equal.
struct ProcessGroupLess {
    bool operator()(const VSProcessGroup &a, const VSProcessGroup &b) const;
    bool operator()(const VSProcessGroup *a, const VSProcessGroup *b) const { return (*this)(*a, *b); }
};

} // namespace vs

class VSVestageSharingData {
public:
    // The objects whose group is exactly the key, in the order first met.
    using ProcessGroupToObjects = std::map<VSProcessGroup, vs::MemoryObjectSet, vs::ProcessGroupLess>;
    // A target's groups with their objects, in group order. Each group is
    // stored once, as an entry of processGroupToObjects, and pointed to from
    // here: a group of a few hundred targets is neither copied nor compared
    // for every one of its members.
    using ProcessGroups = std::vector<const ProcessGroupToObjects::value_type *>;
    // Keyed by the target's asNumber (its pid).
    using ProcessToProcessGroups = std::map<std::int64_t, ProcessGroups>;

    const ProcessToProcessGroups &processToProcessGroups() const { return _processToProcessGroups; }
    void setProcessToProcessGroups(ProcessToProcessGroups value) { _processToProcessGroups = std::move(value); }

    // Moving the map keeps its keys where they are, so the pointers of
    // processToProcessGroups stay valid when both are set together.
    const ProcessGroupToObjects &processGroupToObjects() const { return _processGroupToObjects; }
    void setProcessGroupToObjects(ProcessGroupToObjects value) { _processGroupToObjects = std::move(value); }

    // Takes ownership of memory objects so that they outlive the driver's
    // object tables: the report still reads them through the regions.
    void adoptMemoryObjects(std::vector<std::unique_ptr<VSMemoryObject>> objects);

private:
    ProcessToProcessGroups _processToProcessGroups;
    ProcessGroupToObjects _processGroupToObjects;
    std::vector<std::unique_ptr<VSMemoryObject>> _ownedObjects;
};
