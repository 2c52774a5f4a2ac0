#include "platform/Environment.h"

#include "platform/scripted/ScriptedKernel.h"

namespace tally::platform {

namespace {

class ScriptedEnvironment final : public Environment {
  public:
    ScriptedEnvironment() : task_(addSubject()) {
        kernel_.addTask({.pid = kernel_.ownPid, .name = "contract_tests"}).map({.pages = "D"});
        kernel_.addTask({.pid = 1, .parent = 0, .name = "init"});
        const auto& anonymous =
            task_.map({.start = 0x10'0000, .size = 64 * page, .tag = 1, .pages = "DDRSS"});
        const auto& file = task_.map({.size = 8 * page,
                                      .pages = "CCDA",
                                      .objectPages = PageStates("CCDACC"),
                                      .file = "/usr/lib/libanswer.so"});
        task_.map({.start = 0x20'0000, .size = 16 * page}); // untouched
        task_.map({.pages = PageCounts{.resident = 700, .dirtied = 200, .reusable = 100, .swapped = 3}});
        const auto& inner = ScriptedMapping{.start = 0x80'1000, .size = 2 * page, .pages = "D"};
        task_.map({.start = 0x80'0000,
                   .size = 8 * page,
                   .nested = {inner, {.start = 0x80'6000, .size = page, .pages = "C"}}});
        task_.map({.start = 0x90'0000, .pages = "DDDD", .object = 77, .purgeable = VM_PURGABLE_VOLATILE});
        known_ = {{*anonymous.start, anonymous.size, 3, 2, ""}, {*file.start, file.size, 4, 1, file.file}};
    }

    std::int32_t subject() const override { return task_.pid; }
    std::vector<KnownMapping> knownMappings() const override { return known_; }
    void leaveSubjectAsZombie() override { task_.becomeZombie(); }
    void endSubject() override { task_.exit(); }
    void interrupt() override { kernel_.interrupt(); }
    void terminate() override { kernel_.terminate(); }

  private:
    static constexpr std::uint64_t page = 4096;

    /// Crash information of nothing but its two markers.
    static std::vector<std::byte> emptyCrashInformation() {
        const std::uint64_t words[] = {0xDEADF157, 0, 0xF19158ED, 0};
        const auto bytes = std::as_bytes(std::span(words));
        return {bytes.begin(), bytes.end()};
    }

    ScriptedTask& addSubject() {
        return kernel_.addTask({.pid = 4711,
                                .name = "subject",
                                .crashInformation = emptyCrashInformation(),
                                .usage = {.ri_phys_tally = 40960, .ri_lifetime_max_phys_tally = 81920},
                                .ledger = {{"phys_tally", 40960}, {"page_table", 4096}},
                                .owned = {{{.id = 9, .virtualSize = 4096}}}});
    }

    ScriptedKernel kernel_;
    ScriptedTask& task_;
    std::vector<KnownMapping> known_;
};

} // namespace

std::unique_ptr<Environment> Environment::make() { return std::make_unique<ScriptedEnvironment>(); }

} // namespace tally::platform
