#include "process/CorpseKcdata.h"

#include "platform/kcdata.h"
#include "platform/mach_task.h"

#include <cstring>
#include <optional>

namespace tally {

using namespace platform;

namespace {

/// Takes the first item off `rest`; absent when it does not fit.
std::optional<KcdataItem> takeItem(std::span<const std::byte>& rest) {
    KcdataHeader header;
    if (rest.size() < sizeof header) {
        return std::nullopt;
    }
    std::memcpy(&header, rest.data(), sizeof header);
    const auto payload = rest.subspan(sizeof header);
    if (payload.size() < header.payloadSize) {
        return std::nullopt;
    }
    rest = payload.subspan(header.payloadSize);
    const bool isPaddedArray = (header.type & ~std::uint32_t{0xF}) == kcdataFirstPaddedArray;
    return KcdataItem{isPaddedArray ? kcdataArray : header.type, payload.first(header.payloadSize)};
}

/// Crash information that is mapped into the tool for as long as this lives.
class MappedCrashInformation {
  public:
    explicit MappedCrashInformation(mach_port_t corpse)
        : isMapped_(task_map_corpse_info_64(corpse, &buffer_) == KERN_SUCCESS) {}
    MappedCrashInformation(const MappedCrashInformation&) = delete;
    MappedCrashInformation& operator=(const MappedCrashInformation&) = delete;
    ~MappedCrashInformation() {
        if (isMapped_) {
            vm_deallocate(buffer_);
        }
    }

    bool isMapped() const { return isMapped_; }
    std::span<const std::byte> buffer() const { return buffer_; }

  private:
    std::span<const std::byte> buffer_;
    bool isMapped_;
};

} // namespace

bool enumerateKcdata(std::span<const std::byte> buffer, const KcdataItemHandler& handler) {
    auto item = takeItem(buffer);
    if (!item || item->type != kcdataBegin) {
        return false;
    }
    while (item && item->type != kcdataEnd) {
        handler(*item);
        item = takeItem(buffer);
    }
    return true;
}

bool enumerateCorpseKcdata(mach_port_t corpse, const KcdataItemHandler& handler) {
    if (corpse == MACH_PORT_NULL) {
        return false;
    }
    const MappedCrashInformation information(corpse);
    return information.isMapped() && enumerateKcdata(information.buffer(), handler);
}

} // namespace tally
