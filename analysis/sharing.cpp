#include "analysis/sharing.h"

#include <algorithm>

#include "targets/process.h"

namespace vs {

bool ProcessGroupLess::operator()(const VSProcessGroup &a, const VSProcessGroup &b) const {
    if (a.size() != b.size()) {
        return a.size() < b.size();
    }
    return std::lexicographical_compare(a.begin(), a.end(), b.begin(), b.end(),
                                        [](const VSProcess *x, const VSProcess *y) { return x->pid() < y->pid(); });
}

} // namespace vs

void VSVestageSharingData::adoptMemoryObjects(std::vector<std::unique_ptr<VSMemoryObject>> objects) {
    if (_ownedObjects.empty()) {
        _ownedObjects = std::move(objects);
        return;
    }
    _ownedObjects.reserve(_ownedObjects.size() + objects.size());
    for (std::unique_ptr<VSMemoryObject> &object : objects) {
        _ownedObjects.push_back(std::move(object));
    }
}
