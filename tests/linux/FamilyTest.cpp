// What forked relatives share: the arithmetic against plain models, and real families against what they did.

#include "linux/Puppet.h"
#include "platform/bsd_process.h"
#include "platform/gather.h"
#include "platform/linux/families/SharedParts.h"
#include "platform/mach_task.h"
#include "platform/mach_vm.h"
#include "vm/TLRangeList.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mman.h>
#include <unistd.h>

#include <fstream>
#include <map>
#include <numeric>
#include <random>
#include <set>

namespace tally::platform {
namespace {

using test::Puppet;

constexpr std::uint64_t page = 4096;

TEST(AddressSlots, CutAtEveryBorderAndClusterByOverlap) {
    const std::vector<AddressRange> ranges{{30, 40}, {10, 20}, {15, 30}, {15, 18}, {40, 50}};
    const std::vector<AddressSlot> slots = addressSlots(ranges);
    const std::vector<std::array<std::uint64_t, 4>> expected{
        {10, 15, 0, 10}, {15, 18, 0, 10}, {18, 20, 0, 10}, {20, 30, 0, 10}, {30, 40, 1, 30}, {40, 50, 2, 40}};
    ASSERT_EQ(slots.size(), expected.size());
    for (std::size_t i = 0; i < slots.size(); ++i) {
        EXPECT_EQ((std::array{slots[i].start, slots[i].end, slots[i].cluster, slots[i].clusterStart}),
                  expected[i]);
    }
}

/// Random pages of a family of `members` in two slots, and what a plain model says of them.
struct RandomFamily {
    std::vector<AddressSlot> slots{{0, 64 * page, 0, 0}, {64 * page, 128 * page, 0, 0}};
    SharingSets sets;
    std::map<std::pair<std::size_t, std::vector<std::uint32_t>>, std::pair<std::uint64_t, std::uint64_t>>
        expected;
    std::vector<std::uint64_t> sharedPages; // of each member

    RandomFamily(std::size_t members, unsigned seed) : sets(members), sharedPages(members) {
        std::mt19937 random(seed);
        std::vector<std::uint32_t> all(members);
        std::iota(all.begin(), all.end(), 0);
        for (std::size_t at = 0; at < 128; ++at) {
            std::vector<PageKey> keys(members);
            std::map<PageKey, std::vector<std::uint32_t>> holders;
            for (std::size_t i = 0; i < members; ++i) {
                const std::uint64_t drawn = random() % 5;
                keys[i] = drawn == 0 ? 0 : drawn < 3 ? drawn + at * 8 : residentKey | (drawn + at * 8);
                if (keys[i] != 0) {
                    holders[keys[i]].push_back(all[i]);
                }
            }
            const std::size_t slot = at / 64;
            sets.addPages(slot, all, keys, 1);
            for (const auto& [key, who] : holders) {
                if (who.size() > 1) {
                    auto& [resident, swapped] = expected[{slot, who}];
                    ++((key & residentKey) != 0 ? resident : swapped);
                    for (const std::uint32_t member : who) {
                        ++sharedPages[member];
                    }
                }
            }
        }
    }
};

TEST(SharingSets, FindWhatAPlainModelFinds) {
    for (unsigned seed = 0; seed < 200; ++seed) {
        RandomFamily family(2 + seed % 9, seed);
        const std::vector<SetPages> counts = family.sets.takeCounts();
        EXPECT_EQ(counts.size(), family.expected.size());
        for (const SetPages& count : counts) {
            const auto expected = family.expected.find({count.slot, family.sets.sets()[count.set]});
            ASSERT_NE(expected, family.expected.end());
            EXPECT_EQ(std::pair(count.resident, count.swapped), expected->second);
        }
    }
}

TEST(SharedParts, MergedOverAllMembersCountEveryPageOnce) {
    for (unsigned seed = 0; seed < 100; ++seed) {
        const std::size_t members = 2 + seed % 9;
        RandomFamily family(members, seed);
        const std::vector<SetPages> counts = family.sets.takeCounts();
        std::uint64_t distinct = 0;
        for (const SetPages& count : counts) {
            distinct += count.resident + count.swapped;
        }
        std::vector<MemberIdentity> identities;
        std::vector<std::vector<MemberMapping>> mappings;
        for (std::size_t i = 0; i < members; ++i) {
            identities.push_back({static_cast<std::int32_t>(100 + i), i});
            // Every other member has the range in two mappings.
            mappings.push_back(
                i % 2 == 0 ? std::vector<MemberMapping>{{{0, 128 * page}, 7}}
                           : std::vector<MemberMapping>{{{0, 64 * page}, 3}, {{64 * page, 128 * page}, 4}});
        }
        const std::vector<char> isImage{static_cast<char>(seed % 2)};
        const auto parts =
            sharedParts({1, identities, family.slots, family.sets.sets(), counts, isImage}, mappings);

        std::map<std::uint64_t, TLRangeList> objects;
        for (std::size_t i = 0; i < members; ++i) {
            std::uint64_t pages = 0;
            std::size_t mapping = 0;
            for (const SharedPart& part : parts[i]) {
                EXPECT_GE(part.mapping, mapping);
                mapping = part.mapping;
                pages += part.resident + part.swapped;
                objects[part.objectId].addSubrange(
                    part.pagesBelow * page, (part.resident + part.swapped) * page, page,
                    {.dirty = part.resident * page, .swapped = part.swapped * page});
            }
            EXPECT_EQ(pages, family.sharedPages[i]);
        }
        std::uint64_t merged = 0;
        for (const auto& [id, list] : objects) {
            merged += list.sumSizes().dirty + list.sumSizes().swapped;
        }
        EXPECT_EQ(merged, distinct * page) << seed;
        // Folded: an object per first holder and kind, beside the kept sets. Of an image all sets are kept,
        // while they are few.
        EXPECT_LE(objects.size(), seed % 2 == 0 ? 16 + 2 * members : 64) << seed;
    }
}

/// What a gather of several processes says of one range of addresses.
struct Gathered {
    std::map<std::uint64_t, std::map<int, std::uint64_t>> objects; // id to pid to pages
    std::map<int, std::uint64_t> total;                            // pages of each process in the range
    std::map<int, std::uint64_t> reusable;                         // of these
    std::size_t regions = 0;
    std::set<std::string> notices;

    /// Bytes per exact set of processes.
    std::map<std::set<int>, std::uint64_t> sets() const {
        std::map<std::set<int>, std::uint64_t> bySet;
        for (const auto& [id, holders] : objects) {
            std::set<int> pids;
            std::uint64_t most = 0;
            for (const auto& [pid, pages] : holders) {
                pids.insert(pid);
                most = std::max(most, pages);
            }
            bySet[pids] += most;
        }
        return bySet;
    }
};

Gathered gather(const std::vector<int>& pids, std::uint64_t start, std::uint64_t end, int killedBefore = -1) {
    sysctlbyname_write("vm.self_region_tally", 1);
    std::vector<PortRight> tasks;
    for (const int pid : pids) {
        mach_port_t task = MACH_PORT_NULL;
        EXPECT_EQ(task_read_for_pid(pid, &task), KERN_SUCCESS);
        tasks.emplace_back(task);
    }
    if (killedBefore > 0) {
        kill(killedBefore, SIGKILL);
        while (std::ifstream("/proc/" + std::to_string(killedBefore) + "/maps").peek() != EOF) {
            usleep(1000);
        }
    }
    const GatherScope scope;
    Gathered gathered;
    for (std::size_t i = 0; i < pids.size(); ++i) {
        for (std::uint64_t address = 0, size = 0;; address += size) {
            vm_region_submap_info_64 info;
            std::uint32_t depth = 0;
            std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
            if (mach_vm_region_recurse(tasks[i].name(), &address, &size, &depth, &info, &count) !=
                KERN_SUCCESS) {
                break;
            }
            const std::uint64_t pages = info.pages_resident + info.pages_swapped_out;
            if (address >= start && address < end && pages != 0) {
                gathered.objects[info.object_id_full][pids[i]] += pages;
                gathered.total[pids[i]] += pages;
                gathered.reusable[pids[i]] += info.pages_reusable;
                ++gathered.regions;
            }
        }
        for (std::string& notice : task_take_notices(tasks[i].name()).of_machine) {
            gathered.notices.insert(std::move(notice));
        }
    }
    sysctlbyname_write("vm.self_region_tally", 0);
    return gathered;
}

/// A family of puppets, its range of memory and its members, the parent first.
struct PuppetFamily {
    Puppet puppet;
    std::vector<int> pids;
    std::uint64_t start = 0;
    std::uint64_t end = 0;

    PuppetFamily(const char* kids, const char* pages, const char* how)
        : puppet({"family", kids, pages, how}), pids{puppet.pid()} {
        for (const Puppet::Entry& entry : puppet.ledger()) {
            if (entry.name == "child") {
                pids.push_back(static_cast<int>(entry.size));
            } else {
                start = entry.address;
                end = entry.address + entry.size;
            }
        }
    }
    std::set<int> all() const { return {pids.begin(), pids.end()}; }
    Gathered gathered() const { return gather(pids, start, end); }
};

class Family : public testing::Test {
  protected:
    void SetUp() override {
        if (!test::isRoot()) {
            GTEST_SKIP() << "frame numbers are shown to root only";
        }
    }
};

TEST_F(Family, ExactSetsAreFoundToThePage) {
    struct Case {
        const char* how;
        std::uint64_t sharedByAll; // pages of 2,048
        std::uint64_t ownOfEach;   // of the children; the parent keeps what nobody else has
        std::uint64_t ownOfParent;
    };
    // "half": each of the three children writes 1,024 pages, and the parent is left alone with them.
    // "huge": each child copies one 4 KiB page of each of the four huge pages. "drop": only the parent kept
    // its second half.
    for (const Case& c :
         {Case{"same", 2048, 0, 0}, Case{"half", 1024, 1024, 1024}, Case{"huge", 2044, 4, 4},
          Case{"grow", 2048, 0, 0}, Case{"drop", 1024, 0, 1024}, Case{"leaderless", 2048, 0, 0}}) {
        SCOPED_TRACE(c.how);
        const PuppetFamily family("3", "2048", c.how);
        auto sets = family.gathered().sets();
        EXPECT_EQ(sets[family.all()], c.sharedByAll);
        for (const int pid : family.pids) {
            const std::uint64_t own = pid == family.pids[0] ? c.ownOfParent : c.ownOfEach;
            const auto found = sets.find({pid});
            EXPECT_EQ(found == sets.end() ? 0 : found->second, own);
        }
    }
}

TEST_F(Family, LazilyFreedPagesAreSoWithEachRelative) {
    const PuppetFamily family("3", "4096", "freed");
    const Gathered gathered = family.gathered();
    for (const int pid : family.pids) { // some pages can still wait on a processor's own list
        EXPECT_GT(gathered.reusable.at(pid), 4000U);
    }
}

TEST_F(Family, AMemberThatEndedIsInNoSet) {
    const PuppetFamily family("3", "512", "same");
    const Gathered after = gather(family.pids, family.start, family.end, family.pids[2]);
    EXPECT_FALSE(after.total.contains(family.pids[2]));
    EXPECT_EQ(after.sets().at({family.pids[0], family.pids[1], family.pids[3]}), 512U);
}

TEST_F(Family, ManySetsAreFoldedAndTheirSumStaysExact) {
    const PuppetFamily family("12", "4096", "random");
    const Gathered gathered = family.gathered();
    EXPECT_LE(gathered.regions, 13 * (16 + 13 + 1));
    std::uint64_t sum = 0;
    for (const auto& [set, pages] : gathered.sets()) {
        sum += pages;
    }
    // Every page a child wrote is its own now; the page of before stays once with whoever did not write it.
    std::uint64_t expected = 0;
    for (std::size_t at = 0; at < 4096; ++at) {
        expected += 1; // the parent's
        for (std::size_t child = 0; child < 12; ++child) {
            std::uint64_t x = (child * 1'000'003 + at) * 0x9e3779b97f4a7c15U;
            x = (x ^ x >> 30) * 0xbf58476d1ce4e5b9U;
            expected += (x ^ x >> 31) % 10 < 3 ? 1 : 0;
        }
    }
    EXPECT_EQ(sum, expected);
    for (const int pid : family.pids) {
        EXPECT_EQ(gathered.total.at(pid), 4096U);
    }
}

TEST(Relatives, TwoProcessesInOneAddressSpaceCountOnce) {
    const Puppet puppet({"twins"});
    const Puppet::Entry& memory = puppet.ledger()[0];
    const std::vector<int> pids{puppet.pid(), static_cast<int>(puppet.ledger()[1].size)};
    const std::vector<int> falling(pids.rbegin(), pids.rend()); // rights can be made in any order
    for (const std::vector<int>& order : {pids, falling}) {
        const Gathered gathered = gather(order, memory.address, memory.address + memory.size);
        ASSERT_EQ(gathered.objects.size(), 1U);
        EXPECT_EQ(gathered.sets().at({pids.begin(), pids.end()}), 64U);
    }
    std::vector<PortRight> rights;
    for (const int pid : falling) {
        mach_port_t task = MACH_PORT_NULL;
        task_read_for_pid(pid, &task);
        rights.emplace_back(task);
    }
    std::int64_t tables = 0;
    for (const int pid : pids) {
        ledger_entry_info entry;
        ASSERT_EQ(ledger_entries(pid, std::span(&entry, 1)), 1);
        EXPECT_EQ(entry.lei_balance == 0, pid == pids[1]);
        tables += entry.lei_balance;
    }
    EXPECT_GT(tables, 0);
}

TEST(Relatives, AreKnownWhileThereAreRightsToThem) {
    const Puppet puppet({"family", "1", "4", "same"});
    mach_port_t parent = MACH_PORT_NULL;
    mach_port_t child = MACH_PORT_NULL;
    ASSERT_EQ(task_read_for_pid(puppet.pid(), &parent), KERN_SUCCESS);
    const PortRight right(parent);
    EXPECT_FALSE(task_has_relatives(parent));
    ASSERT_EQ(task_read_for_pid(static_cast<int>(puppet.ledger().back().size), &child), KERN_SUCCESS);
    EXPECT_TRUE(task_has_relatives(parent));
    EXPECT_TRUE(task_has_relatives(child));
    mach_port_deallocate(child);
    EXPECT_FALSE(task_has_relatives(parent));
}

TEST_F(Family, FoundWithoutRandomisedAddressesToo) {
    // Two unrelated programs at the same addresses, each with a child: nothing is shared between the
    // families.
    const std::vector<std::string> fixed{"refuse", "fixed", PUPPET_PROGRAM, "family", "1", "256", "same"};
    const Puppet one(fixed);
    const Puppet two(fixed);
    std::vector<int> pids;
    for (const Puppet* puppet : {&one, &two}) {
        pids.push_back(puppet->pid());
        pids.push_back(static_cast<int>(puppet->ledger()[1].size));
    }
    const Puppet::Entry& memory = one.ledger()[0];
    EXPECT_EQ(memory.address, two.ledger()[0].address);
    const auto sets = gather(pids, memory.address, memory.address + memory.size).sets();
    EXPECT_EQ(sets.at({pids[0], pids[1]}), 256U);
    EXPECT_EQ(sets.at({pids[2], pids[3]}), 256U);
    EXPECT_EQ(sets.size(), 2U);
}

} // namespace
} // namespace tally::platform
