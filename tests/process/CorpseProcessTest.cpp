#include "platform/mach_task.h"
#include "platform/scripted/ScriptedKernel.h"
#include "process/CorpseKcdata.h"
#include "process/TLCorpseProcess.h"
#include "vm/PhysTallyCollection.h"

#include <gtest/gtest.h>

#include <random>

namespace tally {
namespace {

using namespace platform;
using Bytes = std::vector<std::byte>;

constexpr std::uint32_t begin = 0xDEADF157;
constexpr std::uint32_t end = 0xF19158ED;

template <typename Number>
std::string raw(Number value) {
    return {reinterpret_cast<const char*>(&value), sizeof value};
}

std::string item(std::uint32_t type, const std::string& payload = "") {
    return raw(type) + raw(static_cast<std::uint32_t>(payload.size())) + raw(~std::uint64_t{0}) + payload;
}

/// Crash information of these items.
Bytes kcdata(const std::string& items) {
    const auto bytes = std::as_bytes(std::span(items));
    return {bytes.begin(), bytes.end()};
}

const Bytes wholeCrash =
    kcdata(item(begin) + item(0x805, raw(9)) + item(0x805, raw(123)) +
           item(0x80F, std::string("/usr/libexec/foo\0rest", 21)) + item(0x815, raw(0x4 | 0x20000)) +
           item(0x819, raw(3)) + item(0x825, raw(0x5000ull)) + item(0x826, raw(70ull)) +
           item(0x827, raw(90ull)) + item(end) + item(0x805, raw(1)));

class Corpse : public testing::Test {
  protected:
    Corpse() { setPhysTallyCollectionEnabled(1); }

    std::shared_ptr<TLCorpseProcess> corpseWith(Bytes crash) {
        task.crashInformation = std::move(crash);
        mach_port_t port = MACH_PORT_NULL;
        task_read_for_pid(50, &port);
        const PortRight live(port);
        task_generate_corpse(port, &port);
        const PortRight given(port);
        return TLCorpseProcess::initWithCorpse(port);
    }

    ScriptedKernel kernel;
    ScriptedTask& task = kernel.addTask({.pid = 50, .name = "live"});
};

TEST_F(Corpse, IsMadeOfItsCrashInformation) {
    task.map({.tag = 30, .pages = "D"});
    auto corpse = corpseWith(wholeCrash);
    ASSERT_TRUE(corpse);
    EXPECT_EQ(kernel.heldPortReferences(), 1u) << "the corpse's own";
    EXPECT_EQ(corpse->displayString(), "foo [123] (corpse)");
    EXPECT_TRUE(corpse->is64bit() && corpse->isTranslated());
    EXPECT_EQ(corpse->idleExitStatus(), TLIdleExitStatus::clean);
    setPhysTallyCollectionEnabled(0);
    const auto seenAsObjects = corpseWith(wholeCrash);
    seenAsObjects->gatherData();
    EXPECT_EQ(seenAsObjects->memoryRegions().size(), 1u) << "page tables are a charge";
    setPhysTallyCollectionEnabled(1);
    task.exit(); // it no longer matters
    corpse->gatherData();
    ASSERT_EQ(corpse->memoryRegions().size(), 2u);
    EXPECT_EQ(corpse->memoryRegions()[1].size, 0x5000u) << "page tables";
    EXPECT_EQ(corpse->auxData(), (TLAuxDictionary{{{"phys_tally", TLAuxData(70, false)},
                                                   {"phys_tally_peak", TLAuxData(90, false)}}}));
    for (const char* call :
         {"sysctl_owned_vmobjects", "proc_pid_rusage", "ledger_entries", "proc_get_dirty"}) {
        EXPECT_EQ(kernel.callCount(call), 0u) << call;
    }
}

TEST_F(Corpse, MakesDoWithMissingAndShortItemsButNotWithDamage) {
    const auto corpse =
        corpseWith(kcdata(item(begin) + item(0x805, "ab") + item(0x80F, std::string(2000, 'x'))));
    ASSERT_TRUE(corpse);
    EXPECT_EQ(corpse->pid(), -1);
    EXPECT_EQ(corpse->name().size(), 1023u) << "the longest path";
    EXPECT_EQ(corpseWith(kcdata(item(begin) + item(0x805, raw(50))))->displayString(), " [50] (corpse)")
        << "its pid may be another process's by now";
    EXPECT_EQ(corpse->idleExitStatus(), TLIdleExitStatus::dirty) << "missing flags are all set";
    EXPECT_FALSE(corpse->is64bit() || corpse->isTranslated() || corpse->auxData());
    EXPECT_FALSE(TLCorpseProcess::initWithCorpse(MACH_PORT_NULL));
    EXPECT_FALSE(corpseWith({}));
    EXPECT_FALSE(corpseWith(kcdata(item(0x805, "abcd") + item(begin))));
    kernel.fail("task_map_corpse_info_64", KERN_FAILURE);
    EXPECT_FALSE(corpseWith(wholeCrash));
    kernel.fail("mach_port_retain", KERN_NO_SPACE);
    testing::internal::CaptureStderr();
    EXPECT_FALSE(corpseWith(wholeCrash));
    EXPECT_TRUE(testing::internal::GetCapturedStderr().starts_with("initWithCorpse:mach_port_mod_refs: "));
    EXPECT_EQ(kernel.heldBuffers(), 0u);
    EXPECT_EQ(kernel.heldPortReferences(), 1u) << "the corpse that was made";
}

TEST(Kcdata, CallsArraysSoWhateverTheirPadding) {
    std::string types;
    const auto note = [&](const KcdataItem& each) { types += std::to_string(each.type) + " "; };
    enumerateKcdata(kcdata(item(begin) + item(0x1F) + item(0x20) + item(0x2F) + item(0x30)), note);
    EXPECT_EQ(types, "3735941463 31 17 17 48 ");
}

TEST(Kcdata, EndsBeforeAnItemThatDoesNotFit) {
    const auto itemsOf = [](Bytes bytes) {
        bytes.shrink_to_fit(); // so that the address sanitizer sees the end
        std::size_t items = 0;
        EXPECT_TRUE(enumerateKcdata(bytes, [&](const KcdataItem&) { ++items; }));
        return items;
    };
    const auto firstBytes = [](std::size_t count) {
        return Bytes(wholeCrash.begin(), wholeCrash.begin() + count);
    };
    EXPECT_EQ(itemsOf(wholeCrash), 9u);
    EXPECT_EQ(itemsOf(firstBytes(16 + 20)), 2u);
    EXPECT_EQ(itemsOf(firstBytes(16 + 19)), 1u) << "a payload is cut off";
    EXPECT_EQ(itemsOf(firstBytes(16 + 15)), 1u) << "a header is cut off";
    std::mt19937 random(1);
    for (int round = 0; round < 2000; ++round) {
        Bytes damaged = firstBytes(17 + random() % (wholeCrash.size() - 16));
        for (int i = 0; i < 3; ++i) {
            damaged[16 + random() % (damaged.size() - 16)] = static_cast<std::byte>(random());
        }
        EXPECT_LE(itemsOf(damaged), damaged.size() / 16);
    }
}

} // namespace
} // namespace tally
