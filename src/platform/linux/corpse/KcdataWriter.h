// KcdataWriter: a kcdata buffer, item by item.

#pragma once

#include "platform/kcdata.h"

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>
#include <string_view>
#include <vector>

namespace tally::platform {

/// Appends items to a buffer that begins and ends as crash information does. Payloads are padded to 16 bytes;
/// the flags of an item say by how many.
class KcdataWriter {
  public:
    KcdataWriter() { add(kcdataBegin, {}); }

    template <typename Number>
    void addNumber(std::uint32_t type, Number number) {
        add(type, std::as_bytes(std::span(&number, 1)));
    }
    /// Appends `text` and a NUL.
    void addText(std::uint32_t type, std::string_view text) {
        std::vector<char> bytes(text.begin(), text.end());
        bytes.push_back('\0');
        add(type, std::as_bytes(std::span(bytes)));
    }
    std::vector<std::byte> finish() {
        add(kcdataEnd, {});
        return std::move(buffer_);
    }

  private:
    static constexpr std::size_t alignment = 16;

    void add(std::uint32_t type, std::span<const std::byte> payload) {
        const std::size_t padded = (payload.size() + alignment - 1) / alignment * alignment;
        appendBytes(KcdataHeader{type, static_cast<std::uint32_t>(padded), padded - payload.size()});
        buffer_.insert(buffer_.end(), payload.begin(), payload.end());
        buffer_.resize(buffer_.size() + padded - payload.size());
    }
    template <typename Number>
    void appendBytes(Number number) {
        const auto bytes = std::as_bytes(std::span(&number, 1));
        buffer_.insert(buffer_.end(), bytes.begin(), bytes.end());
    }

    std::vector<std::byte> buffer_;
};

} // namespace tally::platform
