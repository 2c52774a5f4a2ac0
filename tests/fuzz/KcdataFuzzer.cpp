// Any bytes as the crash information of a corpse: nothing outside them is read, and the walk ends.

#include "platform/mach_task.h"
#include "process/CorpseKcdata.h"

#include <cstdlib>
#include <cstring>
#include <vector>

namespace tally::platform {

namespace {

std::span<const std::byte> crashInformation;
bool isMapped = false;

} // namespace

kern_return_t task_map_corpse_info_64(mach_port_t /*corpse*/, std::span<const std::byte>* buffer) {
    *buffer = crashInformation;
    isMapped = true;
    return KERN_SUCCESS;
}

kern_return_t vm_deallocate(std::span<const std::byte> /*buffer*/) {
    isMapped = false;
    return KERN_SUCCESS;
}

} // namespace tally::platform

extern "C" int LLVMFuzzerTestOneInput(const unsigned char* bytes, std::size_t size) {
    using namespace tally;
    const std::vector<std::byte> copy(reinterpret_cast<const std::byte*>(bytes),
                                      reinterpret_cast<const std::byte*>(bytes) +
                                          size); // ends where they end
    platform::crashInformation = copy;
    std::size_t covered = 0;
    std::uint32_t begin = 0;
    std::memcpy(&begin, bytes, size < sizeof begin ? 0 : sizeof begin);
    const bool isValid = enumerateCorpseKcdata(1, [&](const KcdataItem& item) {
        std::vector<std::byte> payload(item.payload.begin(), item.payload.end());
        covered += 16 + payload.size();
    });
    if (covered > size || platform::isMapped || (isValid && begin != 0xDEADF157) ||
        (!isValid && covered != 0)) {
        std::abort();
    }
    return 0;
}
