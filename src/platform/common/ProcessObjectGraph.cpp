#include "platform/quarry.h"

#include <algorithm>
#include <iterator>

namespace tally::platform {

std::optional<QRYArchitecture> QRYArchitectureOf(std::string_view processDescription,
                                                 std::string_view binaryImages) {
    const auto* const named = std::ranges::find_if(QRYArchitectures, [&](const QRYArchitecture& known) {
        return processDescription.find(known.word) != std::string_view::npos;
    });
    if (named == std::end(QRYArchitectures)) {
        return std::nullopt;
    }
    QRYArchitecture architecture = *named;
    if (architecture.word == "ARM" && binaryImages.find("arm64_32") != std::string_view::npos) {
        architecture.cacheBase = 0x1A000000;
    }
    return architecture;
}

std::string_view QRYHostArchitecture([[maybe_unused]] bool is64bit) {
#if defined(__x86_64__) || defined(__i386__)
    return is64bit ? "X86-64" : "X86";
#elif defined(__aarch64__) || defined(__arm__)
    return is64bit ? "ARM64" : "ARM";
#else
    return "";
#endif
}

std::string QRYProcessObjectGraph::processDescriptionString() const {
    return "process on " +
           (snapshot_.architecture.empty() ? "an unknown architecture" : snapshot_.architecture) +
           (snapshot_.isTranslated ? " (translated)" : "");
}

void QRYProcessObjectGraph::enumerateRegions(const std::function<bool(const QRYVMRegion&)>& visitor) const {
    for (const QRYVMRegion& region : snapshot_.regions) {
        if (visitor(region)) {
            return;
        }
    }
}

} // namespace tally::platform
