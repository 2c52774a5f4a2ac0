#include "platform/linux/objects/ObjectId.h"

#include "platform/linux/io/SystemFiles.h"

#include <initializer_list>
#include <string>

namespace tally::platform {

namespace {

/// One round of mixing: every bit of `value` reaches every bit of the result (the finaliser of splitmix64).
std::uint64_t mixed(std::uint64_t value) {
    value += 0x9e3779b97f4a7c15;
    value = (value ^ value >> 30) * 0xbf58476d1ce4e5b9;
    value = (value ^ value >> 27) * 0x94d049bb133111eb;
    return value ^ value >> 31;
}

std::uint64_t bootIdentity() {
    static const std::uint64_t identity = [] {
        std::uint64_t hash = 0;
        for (const char letter : readSystemFile(systemPath("/proc/sys/kernel/random/boot_id")).value_or("")) {
            hash = mixed(hash ^ static_cast<unsigned char>(letter));
        }
        return hash;
    }();
    return identity;
}

std::uint64_t identityOf(std::initializer_list<std::uint64_t> facts) {
    std::uint64_t hash = bootIdentity();
    for (const std::uint64_t fact : facts) {
        hash = mixed(hash ^ fact);
    }
    return hash == 0 || hash == ~std::uint64_t{0} ? 1 : hash;
}

// The first fact keeps kinds of objects apart.
constexpr std::uint64_t ofFile = 1;
constexpr std::uint64_t ofTask = 2;
constexpr std::uint64_t ofSharedSet = 3;
constexpr std::uint64_t ofFoldedSets = 4;
constexpr std::uint64_t ofKernelBuffer = 5;
constexpr std::uint64_t ofMarkedPages = 6;

} // namespace

std::uint64_t objectIdOfFile(const BackingObject& object) {
    return identityOf({ofFile, object.isSysV ? 1U : 0U, object.device, object.inode});
}

std::uint64_t objectIdOfMarkedPages(std::uint64_t objectId) { return identityOf({ofMarkedPages, objectId}); }

std::uint64_t objectIdOfTaskMemory(std::int32_t pid, std::uint64_t startTicks, std::uint64_t start) {
    return identityOf({ofTask, static_cast<std::uint64_t>(pid), startTicks, start});
}

std::uint64_t combinedIdentity(std::uint64_t first, std::uint64_t second, std::uint64_t third) {
    return identityOf({first, second, third});
}

std::uint64_t objectIdOfSharedSet(std::uint64_t set, std::uint64_t cluster) {
    return identityOf({ofSharedSet, set, cluster});
}

std::uint64_t objectIdOfFoldedSets(std::uint64_t firstHolder, std::uint64_t cluster, bool resident) {
    return identityOf({ofFoldedSets, firstHolder, cluster, resident ? 1U : 0U});
}

std::uint64_t objectIdOfKernelBuffer(KernelBuffer kind, std::uint64_t number) {
    return identityOf({ofKernelBuffer, static_cast<std::uint64_t>(kind), number});
}

} // namespace tally::platform
