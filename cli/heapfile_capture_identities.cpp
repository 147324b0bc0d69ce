#include "cli/heapfile_capture_identities.h"

#include "targets/platform/linux/object_ids.h"

namespace vs {

std::optional<std::string> linuxObjectIdentity(uint32_t objectId) {
    return ObjectIdTable::shared().stableIdentity(objectId);
}

}  // namespace vs
