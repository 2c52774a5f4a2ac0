#include "platform/linux/owned/DescriptorInfo.h"

#include "platform/linux/io/TextScan.h"
#include "platform/linux/objects/ObjectId.h"

#include <algorithm>
#include <array>
#include <functional>
#include <map>

namespace tally::platform {

namespace {

void forEachLine(std::string_view text,
                 const std::function<void(std::string_view key, std::string_view value)>& visitor) {
    while (!text.empty()) {
        std::string_view value = takeLine(text);
        const std::string_view key = takeUntil(value, ':');
        skipBlanks(value);
        visitor(key, value);
    }
}

/// "123", "123 KiB" or "123 MiB", in bytes; 0 for what is none.
std::uint64_t sizeOf(std::string_view value) {
    std::uint64_t number = 0;
    takeNumber(value, &number);
    const std::string_view unit = takeWord(value);
    const int shift = unit == "KiB" ? 10 : unit == "MiB" ? 20 : unit == "GiB" ? 30 : 0;
    return number > ~std::uint64_t{0} >> shift ? 0 : number << shift;
}

/// What a client has in one region of a graphics device's memory.
struct RegionMemory {
    std::uint64_t total = 0;
    std::uint64_t shared = 0;
    std::uint64_t resident = 0;
    std::uint64_t purgeable = 0;
    std::uint64_t memory = 0; // resident, by its older name
};

struct RegionKey {
    std::string_view beginning;
    std::uint64_t RegionMemory::*figure;
};
constexpr std::array<RegionKey, 5> regionKeys{{{"drm-total-", &RegionMemory::total},
                                               {"drm-shared-", &RegionMemory::shared},
                                               {"drm-resident-", &RegionMemory::resident},
                                               {"drm-purgeable-", &RegionMemory::purgeable},
                                               {"drm-memory-", &RegionMemory::memory}}};

bool isOnDevice(std::string_view region) {
    constexpr std::array<std::string_view, 7> names{"vram", "local", "stolen",  "gds",
                                                    "gws",  "oa",    "doorbell"};
    return std::any_of(names.begin(), names.end(),
                       [&](std::string_view name) { return region.starts_with(name); });
}

constexpr std::uint8_t graphicsLedger = 4;

std::uint64_t less(std::uint64_t a, std::uint64_t b) { return a > b ? a - b : 0; }

} // namespace

std::optional<owned_vmobject> decodeDmaBuffer(std::string_view text) {
    std::uint64_t number = 0;
    owned_vmobject record{.ledgerTag = graphicsLedger, .purgeable = VM_PURGABLE_DENY};
    bool isMemfd = false;
    forEachLine(text, [&](std::string_view key, std::string_view value) {
        if (key == "ino") {
            takeNumber(value, &number);
        } else if (key == "size") {
            record.virtualSize = record.residentSize = sizeOf(value);
        } else if (key == "exp_name") {
            isMemfd = value == "udmabuf";
        }
    });
    record.id = objectIdOfKernelBuffer(KernelBuffer::dmaBuffer, number);
    return number != 0 && !isMemfd && record.holdsMemory() ? std::optional(record) : std::nullopt;
}

std::optional<owned_vmobject> decodeGraphicsClient(std::string_view text) {
    std::optional<std::uint64_t> client;
    std::map<std::string_view, RegionMemory> regions;
    forEachLine(text, [&](std::string_view key, std::string_view value) {
        std::uint64_t number = 0;
        if (key == "drm-client-id" && takeNumber(value, &number)) {
            client = number;
        }
        for (const RegionKey& known : regionKeys) {
            if (key.starts_with(known.beginning) && !isOnDevice(key.substr(known.beginning.size()))) {
                regions[key.substr(known.beginning.size())].*known.figure = sizeOf(value);
            }
        }
    });
    owned_vmobject record{.ledgerTag = graphicsLedger, .purgeable = VM_PURGABLE_DENY};
    for (const auto& [name, region] : regions) {
        const std::uint64_t resident = less(std::max(region.resident, region.memory), region.shared);
        record.residentSize += resident;
        record.reusableSize += std::min(region.purgeable, resident);
        record.virtualSize += std::max(less(region.total, region.shared), resident);
    }
    record.id = objectIdOfKernelBuffer(KernelBuffer::graphicsClient, client.value_or(0));
    return client && record.holdsMemory() ? std::optional(record) : std::nullopt;
}

std::optional<owned_vmobject> decodeBpfMap(std::string_view text) {
    std::optional<std::uint64_t> map;
    owned_vmobject record{.noTally = true, .purgeable = VM_PURGABLE_DENY};
    forEachLine(text, [&](std::string_view key, std::string_view value) {
        std::uint64_t number = 0;
        if (key == "map_id" && takeNumber(value, &number)) {
            map = number;
        } else if (key == "memlock") {
            record.virtualSize = record.residentSize = record.wiredSize = sizeOf(value);
        }
    });
    record.id = objectIdOfKernelBuffer(KernelBuffer::bpfMap, map.value_or(0));
    return map && record.holdsMemory() ? std::optional(record) : std::nullopt;
}

} // namespace tally::platform
