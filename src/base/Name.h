// Name: one text kept once for the whole run.
//
// Regions carry two names each and there are hundreds of thousands of them with a few thousand distinct
// texts, so a region holds pointers into one table. The table only grows. Equal texts give equal pointers.
// Thread-safe: processes are gathered at once.

#pragma once

#include <string>
#include <string_view>

namespace tally {

class Name {
  public:
    /// The absent name: different from the empty text.
    Name() = default;
    /// Interns `text`, which may hold any bytes.
    explicit Name(std::string_view text);

    bool isNull() const { return text_ == nullptr; }
    /// Whether the name is absent or has no characters.
    bool empty() const { return text_ == nullptr || text_->empty(); }
    /// The text; empty for an absent name. Valid for the run.
    std::string_view view() const { return text_ == nullptr ? std::string_view() : std::string_view(*text_); }

    friend bool operator==(Name, Name) = default;

  private:
    const std::string* text_ = nullptr;
};

} // namespace tally
