// Gather: what is found out once for all processes that are measured together.
//
// Each room keeps its own kind of knowledge in a table that the first who asks makes. All of them go with the
// gather. Thread-safe; one gather at a time. A table is made under the lock: making one asks for no other.

#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <typeindex>

namespace tally::platform {

class Gather {
  public:
    Gather();
    ~Gather();
    Gather(const Gather&) = delete;
    Gather& operator=(const Gather&) = delete;

    /// The table of that type of the gather that is under way; null when none is.
    template <typename Table>
    static Table* table() {
        Gather* const gather = current();
        if (gather == nullptr) {
            return nullptr;
        }
        const std::scoped_lock lock(gather->mutex_);
        std::shared_ptr<void>& table = gather->tables_[typeid(Table)];
        if (!table) {
            table = std::make_shared<Table>();
        }
        return static_cast<Table*>(table.get());
    }

  private:
    static Gather* current();

    std::mutex mutex_;
    std::map<std::type_index, std::shared_ptr<void>> tables_;
};

} // namespace tally::platform
