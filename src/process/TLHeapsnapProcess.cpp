#include "process/TLHeapsnapProcess.h"

#include "base/Assertion.h"
#include "base/Format.h"

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <string_view>
#include <system_error>
#include <unordered_map>
#include <utility>

namespace tally {

using namespace platform;

namespace {

/// The whole of a file; only of a regular one, since others may never end. Read, never mapped: it can be cut
/// off meanwhile.
std::string contentsOfFile(const std::string& path, std::error_code& failure) {
    const auto status = std::filesystem::status(path, failure);
    if (failure) {
        return {};
    }
    if (!std::filesystem::is_regular_file(status)) {
        failure = std::make_error_code(std::filesystem::is_directory(status) ? std::errc::is_a_directory
                                                                             : std::errc::invalid_argument);
        return {};
    }
    std::ifstream file(path, std::ios::binary);
    if (!file) {
        failure = std::error_code(errno, std::generic_category());
        return {};
    }
    constexpr std::size_t step = 1 << 20;
    std::string contents;
    const std::uintmax_t told = std::filesystem::file_size(path, failure);
    bool isTooLarge = told > QRYLargestSnapshotFile;
    // It may grow or shrink meanwhile. The kernel's own files tell no size, and some never end.
    while (file && told != 0 && !isTooLarge) {
        const std::size_t size = contents.size();
        contents.resize(size + step);
        file.read(contents.data() + size, step);
        contents.resize(size + static_cast<std::size_t>(file.gcount()));
        isTooLarge = contents.size() > QRYLargestSnapshotFile;
    }
    if (isTooLarge || file.bad()) {
        failure = std::make_error_code(isTooLarge ? std::errc::file_too_large : std::errc::io_error);
    }
    return contents;
}

uuid_t randomUuid() {
    std::random_device random;
    uuid_t uuid;
    std::ranges::generate(uuid, [&] { return static_cast<std::uint8_t>(random()); });
    return uuid;
}

/// Which memory of VM objects the regions of one process have been charged for: a page that it maps twice
/// counts at its first mapping only.
class ChargedObjects {
  public:
    /// Charges for as much of `bytes` in [offset, offset + length) of `object` as can be there beside what is
    /// charged for already. @return that much.
    std::uint64_t charge(std::uint64_t object, std::uint64_t offset, std::uint64_t length,
                         std::uint64_t bytes) {
        if (length > ~offset) { // beyond the last offset that there is: a damaged file, taken at its word
            return bytes;
        }
        std::map<std::uint64_t, Extent>& extents = extentsOf_[object];
        Extent united{.end = offset + length};
        std::uint64_t start = offset;
        auto next = extents.upper_bound(offset);
        if (next != extents.begin() && std::prev(next)->second.end > offset) {
            --next;
        }
        while (next != extents.end() && next->first < united.end) {
            start = std::min(start, next->first);
            united.end = std::max(united.end, next->second.end);
            united.charged += next->second.charged;
            next = extents.erase(next);
        }
        const std::uint64_t room = united.end - start - united.charged;
        const std::uint64_t charged = std::min(bytes, room);
        united.charged += charged;
        extents.emplace(start, united);
        return charged;
    }

  private:
    struct Extent {
        std::uint64_t end = 0;
        std::uint64_t charged = 0; // bytes
    };
    std::unordered_map<std::uint64_t, std::map<std::uint64_t, Extent>> extentsOf_; // by object, by start
};

bool isPresetName(std::string_view type) {
    return type == "commpage (reserved)" || type == "GPU Carveout (reserved)";
}

} // namespace

std::shared_ptr<TLHeapsnapProcess>
TLHeapsnapProcess::initWithGraph(std::unique_ptr<const QRYProcessObjectGraph> graph) {
    const auto process = std::make_shared<TLHeapsnapProcess>();
    process->graph_ = std::move(graph);
    proc_bsdinfo info;
    info.pbi_flags = process->graph_->is64bit() ? PROC_FLAG_LP64 : 0;
    info.pbi_pid = static_cast<std::uint32_t>(process->graph_->pid());
    if (!process->initWithBsdInfo(info)) {
        return nullptr;
    }
    process->setName(process->graph_->processName());
    process->setDisplayString(formatted("%s [%d] (heapsnap)", process->name().c_str(), process->pid()));
    process->setIdleExitStatus(TLIdleExitStatus::unknown);
    process->makeSharedCache();
    return process;
}

void TLHeapsnapProcess::makeSharedCache() {
    const auto architecture =
        QRYArchitectureOf(graph_->processDescriptionString(), graph_->binaryImagesDescription());
    if (!architecture) {
        printLineToStandardError("Unable to determine platform architecture of target");
        return;
    }
    auto cache = std::make_shared<TLSharedCache>();
    cache->uuid = randomUuid();
    cache->baseAddress = architecture->cacheBase;
    cache->mappedSize = architecture->cacheSize;
    setSharedCache(std::move(cache));
}

void TLHeapsnapProcess::_gatherIsTranslated() {
    setIsTranslated(graph_->processDescriptionString().find("(translated)") != std::string::npos);
}

void TLHeapsnapProcess::_gatherPhysTally() {
    setLedgers({.physTally = graph_->physicalTally(), .physTallyPeak = graph_->physicalTallyPeak()});
}

void TLHeapsnapProcess::enumerateRegions(const RegionCallback& callback) {
    static const Name sharedLinkedit("dyld shared cache");
    const TLSharedCache* const cache = sharedCache().get();
    ChargedObjects charged;
    std::uint64_t repeated = 0; // bytes
    graph_->enumerateRegions([&](QRYVMRegion region) {
        if (graph_->showsPhysTally() && region.object_id != 0 && region.object_id != TLNotSet) {
            const std::uint64_t told = region.dirty_size + region.swapped_out_size;
            const std::uint64_t own = charged.charge(region.object_id, region.offset, region.length, told);
            const std::uint64_t dirty = std::min(region.dirty_size, own);
            region.resident_size -= region.dirty_size - dirty;
            region.dirty_size = dirty;
            region.swapped_out_size = own - dirty;
            repeated += told - own;
        }
        const bool inCache = cache != nullptr && cache->contains(region.address);
        TLImage image;
        image.setName(region.type);
        if (image.segment != TLSegmentKind::notSet) {
            image.start = region.address;
            image.size = region.length;
            image.ownerPath =
                inCache && image.segment == TLSegmentKind::linkedit ? sharedLinkedit : region.path;
            walk_.images.push_back(image); // the callback names the region by it
        }
        return callback(describe(region, inCache));
    });
    if (repeated != 0) {
        addWarning(displayString() +
                   formatted(": %" PRIu64 " bytes of memory that is mapped several times are counted once",
                             repeated));
    }
}

/// A region as the kernel would describe it. Inside the shared cache counts stay bytes: there no page is
/// asked for, and what stands for that takes them as they are.
EnumeratedRegion TLHeapsnapProcess::describe(const QRYVMRegion& region, bool inCache) const {
    const std::uint64_t unit = inCache ? 1 : pageSize();
    const auto count = [&](std::uint64_t bytes) {
        return static_cast<std::uint32_t>(unit == 0 ? 0 : bytes / unit);
    };
    EnumeratedRegion described;
    described.start = region.address;
    described.size = region.length;
    described.info = {
        .protection = region.prot,
        .max_protection = region.maxProt,
        .offset = region.offset,
        .user_tag = region.user_tag,
        .pages_resident = count(region.resident_size),
        .pages_shared_now_private = count(region.shared_now_private_size),
        .pages_swapped_out = count(region.swapped_out_size),
        .pages_dirtied = count(region.dirty_size),
        .ref_count = region.ref_count,
        .external_pager = region.external_pager,
        .share_mode = region.share_mode,
        .is_submap = region.is_submap ? 1U : 0U,
        .object_id = static_cast<std::uint32_t>(region.object_id),
        .user_wired_count = static_cast<std::uint16_t>(region.is_wired ? 1 : 0),
        .pages_reusable = count(region.reusable_size),
        .object_id_full = region.object_id,
    };
    described.purgeState = region.purgeable;
    if (region.external_pager != 0 && !region.path.isNull()) {
        described.fileName = region.path.view();
    }
    if (isPresetName(region.type.view())) {
        described.presetName = region.type.view();
        described.verbose = true;
    }
    return described;
}

bool TLHeapsnapProcess::_populateMemoryRegionWithPageQueries(TLMemoryRegion& region,
                                                             const vm_region_submap_info_64& info) {
    tl_assert(region.dirtySize == 0 && region.swappedSize == 0, "!region.dirtySize && !region.swappedSize");
    region.dirtySize = info.pages_dirtied;
    region.swappedSize = info.pages_swapped_out;
    return true;
}

std::shared_ptr<TLProcess> processWithHeapsnap(const std::string& path, std::optional<TLError>* error) {
    std::error_code failure;
    const std::string contents = contentsOfFile(path, failure);
    std::optional<TLError> reason;
    std::shared_ptr<TLProcess> process;
    if (failure) {
        reason = TLError{failure.category().name(), failure.value(), failure.message()};
    } else {
        std::string message;
        if (auto graph = QRYDirectedGraphWithData(contents, &message)) {
            process = TLHeapsnapProcess::initWithGraph(std::move(graph));
        } else {
            reason = TLError{TallyErrorDomain, 1,
                             message.empty() ? "heapsnap initialization failed with unknown error" : message};
        }
    }
    if (error != nullptr) {
        *error = std::move(reason);
    }
    return process;
}

} // namespace tally
