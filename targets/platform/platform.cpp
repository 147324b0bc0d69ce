#include "targets/platform/platform.h"

#include <atomic>

#include "model/assert.h"

namespace {

std::atomic<VSPlatform *> installedPlatform{nullptr};

}  // namespace

VSPlatform &VSPlatform::current() {
    VSPlatform *platform = installedPlatform.load(std::memory_order_acquire);
    VS_ASSERT(platform != nullptr);
    return *platform;
}

void VSPlatform::setCurrent(VSPlatform *platform) {
    installedPlatform.store(platform, std::memory_order_release);
}

VSPlatform *VSPlatform::installed() {
    return installedPlatform.load(std::memory_order_acquire);
}
