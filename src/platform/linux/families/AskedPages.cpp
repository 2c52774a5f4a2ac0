#include "platform/linux/families/AskedPages.h"

#include <algorithm>

namespace tally::platform {

namespace {

constexpr std::uint64_t nowhere = ~std::uint64_t{0};
const std::uint64_t pagesAhead = (16 << 20) / basePage;

} // namespace

std::uint64_t AskedPages::next(std::uint64_t address) {
    skip(address);
    while (runs_.empty() && askOn()) {
    }
    return runs_.empty() ? nowhere : runs_.front().start;
}

std::vector<FoundRun> AskedPages::takeBelow(std::uint64_t end) {
    while ((runs_.empty() || runs_.back().end < end) && askOn()) {
    }
    std::vector<FoundRun> taken;
    while (!runs_.empty() && runs_.front().start < end) {
        taken.push_back(runs_.front());
        if (runs_.front().end > end) {
            taken.back().end = end;
            runs_.front().start = end;
            break;
        }
        runs_.pop_front();
    }
    return taken;
}

void AskedPages::skip(std::uint64_t address) {
    while (!runs_.empty() && runs_.front().end <= address) {
        runs_.pop_front();
    }
    if (!runs_.empty()) {
        runs_.front().start = std::max(runs_.front().start, address);
    }
    while (at_ < asked_.size() && mappings_[asked_[at_]].end <= address) {
        ++at_;
    }
    cursor_.passTo(address);
}

/// Asks for the next pages. @return false when there are none.
bool AskedPages::askOn() {
    if (at_ == asked_.size() || error_ != 0) {
        return false;
    }
    // Neighbours are asked about together.
    std::size_t end = at_ + 1;
    const bool isAnonymous = mappings_[asked_[at_]].isPrivateAnonymous();
    while (end < asked_.size() && asked_[end] == asked_[end - 1] + 1 &&
           mappings_[asked_[end]].isPrivateAnonymous() == isAnonymous) {
        ++end;
    }
    cursor_.passTo(mappings_[asked_[at_]].start);
    cursor_.mapping = std::max(cursor_.mapping, asked_[at_]);
    const PageRunSink take = [&](const FoundRun& run) { runs_.push_back(run); };
    error_ = source_.readOn(asked_[end - 1] + 1, !isAnonymous, pagesAhead, take, &cursor_);
    while (at_ < asked_.size() && mappings_[asked_[at_]].end <= cursor_.address) {
        ++at_;
    }
    return error_ == 0;
}

} // namespace tally::platform
