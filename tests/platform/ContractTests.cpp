// What every platform promises to the layers above, whatever stands behind it.

#include "platform/Environment.h"

#include "platform/bsd_process.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/gather.h"
#include "platform/mach_task.h"
#include "platform/mach_vm.h"
#include "platform/system.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <numeric>
#include <string_view>
#include <thread>

namespace tally::platform {
namespace {

constexpr std::int32_t noSuchPid = 0x7fff'fff0;
constexpr std::uint64_t beyondAll = ~std::uint64_t{0} - 0xffff; // no user mapping lies there

/// What one region query answered.
struct Found {
    kern_return_t status = KERN_SUCCESS;
    std::uint64_t start = 0;
    std::uint64_t size = 0;
    std::uint32_t depth = 0;
    vm_region_submap_info_64 info{};
    std::uint64_t end() const { return start + size; }
};

Found regionAt(mach_port_t task, std::uint64_t address) {
    Found found{.start = address, .depth = ~std::uint32_t{0}};
    std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
    found.status = mach_vm_region_recurse(task, &found.start, &found.size, &found.depth, &found.info, &count);
    return found;
}

std::vector<Found> walk(mach_port_t task) {
    std::vector<Found> regions;
    for (Found next = regionAt(task, 0); next.status == KERN_SUCCESS; next = regionAt(task, next.end())) {
        regions.push_back(next);
        if (next.size == 0 || next.end() < next.start) {
            break; // the test below fails on it; the walk would not end
        }
    }
    return regions;
}

PortRight portOf(std::int32_t pid) {
    mach_port_t task = MACH_PORT_NULL;
    EXPECT_EQ(task_read_for_pid(pid, &task), KERN_SUCCESS);
    return PortRight(task);
}

class Contract : public testing::Test {
  protected:
    std::unique_ptr<Environment> environment = Environment::make();
    const std::int32_t pid = environment->subject();
};

/// The walk, in both positions of the accounting switch.
class WalkContract : public Contract, public testing::WithParamInterface<int> {
  protected:
    WalkContract() { EXPECT_EQ(sysctlbyname_write("vm.self_region_tally", GetParam()), 0); }
    ~WalkContract() override { sysctlbyname_write("vm.self_region_tally", 0); }
    const PortRight port = portOf(pid);
    const std::uint64_t pageSize = vm_kernel_page_size();
};

INSTANTIATE_TEST_SUITE_P(BothViews, WalkContract, testing::Values(0, 1),
                         [](const auto& view) { return view.param == 1 ? "charged" : "object"; });

TEST_P(WalkContract, MappingsRiseAndHoldWhatTheyCount) {
    std::uint64_t end = 0;
    const std::vector<Found> regions = walk(port.name());
    ASSERT_FALSE(regions.empty());
    for (const Found& region : regions) {
        SCOPED_TRACE(testing::Message() << std::hex << region.start << "-" << region.end());
        EXPECT_GE(region.start, end);
        EXPECT_GT(region.size, 0);
        EXPECT_EQ(region.start % pageSize, 0);
        EXPECT_EQ(region.size % pageSize, 0);
        const std::uint64_t pages = region.size / pageSize;
        const auto& info = region.info;
        EXPECT_LE(std::uint64_t{info.pages_resident} + info.pages_swapped_out, pages);
        EXPECT_LE(std::uint64_t{info.pages_dirtied} + info.pages_reusable, info.pages_resident);
        EXPECT_EQ(info.is_submap, 0);
        EXPECT_TRUE(info.share_mode >= SM_COW && info.share_mode <= SM_LARGE_PAGE);
        // Without an object there is at most memory that is nobody's to pay for: the kernel's own pages.
        EXPECT_TRUE(info.object_id_full != 0 || info.pages_dirtied + info.pages_swapped_out == 0);
        EXPECT_NE(info.object_id_full, ~std::uint64_t{0});
        end = region.end();
    }
}

TEST_P(WalkContract, PageQueriesAgreeWithTheCounts) {
    for (const Found& region : walk(port.name())) {
        SCOPED_TRACE(testing::Message() << std::hex << region.start << "-" << region.end());
        std::vector<std::int32_t> words(std::min<std::uint64_t>(region.size / pageSize, 1 << 16), -1);
        std::uint64_t count = words.size();
        ASSERT_EQ(mach_vm_page_range_query(port.name(), region.start, words.size() * pageSize, words, &count),
                  KERN_SUCCESS);
        ASSERT_EQ(count, words.size());
        const auto pagesWith = [&](std::int32_t bit) {
            return std::count_if(words.begin(), words.end(), [&](auto word) { return (word & bit) != 0; });
        };
        EXPECT_EQ(pagesWith(VM_PAGE_QUERY_PAGE_PRESENT), region.info.pages_resident);
        EXPECT_EQ(pagesWith(VM_PAGE_QUERY_PAGE_PAGED_OUT), region.info.pages_swapped_out);
        EXPECT_EQ(pagesWith(VM_PAGE_QUERY_PAGE_DIRTY), region.info.pages_dirtied);
        EXPECT_EQ(pagesWith(VM_PAGE_QUERY_PAGE_REUSABLE), region.info.pages_reusable);
        const auto first = std::find_if(words.begin(), words.end(), [](auto word) { return word != 0; });
        EXPECT_EQ(mach_vm_next_page(port.name(), region.start, region.start + words.size() * pageSize),
                  region.start + (first - words.begin()) * pageSize);
    }
}

TEST_P(WalkContract, KnownMemoryIsCounted) {
    const std::vector<Found> regions = walk(port.name());
    for (const KnownMapping& known : environment->knownMappings()) {
        SCOPED_TRACE(testing::Message() << std::hex << known.start << " " << known.file);
        std::uint64_t covered = 0;
        std::uint64_t resident = 0;
        std::uint64_t dirtied = 0;
        for (const Found& region : regions) {
            if (region.start >= known.start && region.end() <= known.start + known.size) {
                covered += region.size;
                resident += region.info.pages_resident;
                dirtied += region.info.pages_dirtied;
            }
        }
        EXPECT_EQ(covered, known.size);
        if (GetParam() == 1 || known.file.empty()) { // the object of a file is cached beyond what was touched
            EXPECT_EQ(resident, known.resident);
            EXPECT_EQ(dirtied, known.dirtied);
        }
        // A query in the middle finds what covers that address, whatever was asked before.
        const std::uint64_t middle = known.start + known.size / 2;
        std::uint64_t start = middle;
        std::uint64_t size = 0;
        vm_region_basic_info_64 info;
        EXPECT_EQ(mach_vm_region(port.name(), &start, &size, &info), KERN_SUCCESS);
        EXPECT_TRUE(start <= middle && middle < start + size);
        int state = -1;
        EXPECT_EQ(mach_vm_purgable_get_state(port.name(), known.start, &state), KERN_SUCCESS);
        EXPECT_TRUE(state >= VM_PURGABLE_NONVOLATILE && state <= VM_PURGABLE_DENY);
    }
}

TEST_P(WalkContract, ACorpseShowsWhatTheTaskShowedAndOutlivesIt) {
    const auto figures = [](mach_port_t task) {
        std::vector<std::vector<std::uint64_t>> all;
        for (const auto& [status, start, size, depth, info] : walk(task)) {
            all.push_back({start, size, info.pages_resident, info.pages_dirtied, info.pages_swapped_out,
                           info.user_tag, info.object_id_full});
        }
        return all;
    };
    const auto expected = figures(port.name());
    mach_port_t made = MACH_PORT_NULL;
    ASSERT_EQ(task_generate_corpse(port.name(), &made), KERN_SUCCESS);
    const PortRight corpse(made);
    EXPECT_EQ(figures(corpse.name()), expected);
    std::span<const std::byte> information[2];
    for (auto& buffer : information) {
        ASSERT_EQ(task_map_corpse_info_64(corpse.name(), &buffer), KERN_SUCCESS);
        const std::uint32_t beginMarker = 0xDEADF157;
        ASSERT_GE(buffer.size(), 32U);
        EXPECT_EQ(std::memcmp(buffer.data(), &beginMarker, sizeof beginMarker), 0);
    }
    EXPECT_TRUE(std::ranges::equal(information[0], information[1]));
    for (const auto& buffer : information) {
        EXPECT_EQ(vm_deallocate(buffer), KERN_SUCCESS);
    }
    EXPECT_EQ(task_map_corpse_info_64(port.name(), information), KERN_INVALID_ARGUMENT);
    for (const mach_port_t noTask : {MACH_PORT_NULL, corpse.name()}) {
        EXPECT_EQ(task_generate_corpse(noTask, &made), KERN_INVALID_ARGUMENT);
        EXPECT_EQ(made, MACH_PORT_NULL);
    }
    for (const bool isGone : {false, true}) {
        isGone ? environment->endSubject() : environment->leaveSubjectAsZombie();
        EXPECT_EQ(figures(corpse.name()), expected);
        made = corpse.name();
        EXPECT_EQ(task_generate_corpse(port.name(), &made), KERN_TERMINATED);
        EXPECT_EQ(made, MACH_PORT_NULL);
    }
}

TEST_P(WalkContract, WhereNothingIsMappedNothingIsFound) {
    const std::vector<Found> regions = walk(port.name());
    for (const std::uint64_t hole : {regions.front().start - pageSize, regions.back().end()}) {
        std::vector<std::int32_t> word(1, -1);
        std::uint64_t count = 1;
        EXPECT_EQ(mach_vm_page_range_query(port.name(), hole, pageSize, word, &count), KERN_SUCCESS);
        EXPECT_TRUE(count == 1 && word[0] == 0);
    }
    for (int round = 0; round < 2; ++round) { // also when the walk has come to its end before
        std::uint64_t address = beyondAll;
        std::uint64_t size = 17;
        vm_region_basic_info_64 basic{.protection = 42};
        EXPECT_EQ(mach_vm_region(port.name(), &address, &size, &basic), KERN_INVALID_ADDRESS);
        EXPECT_TRUE(address == beyondAll && size == 17 && basic.protection == 42);
        std::uint32_t depth = 5;
        std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        vm_region_submap_info_64 info{.protection = 42};
        EXPECT_EQ(mach_vm_region_recurse(port.name(), &address, &size, &depth, &info, &count),
                  KERN_INVALID_ADDRESS);
        EXPECT_TRUE(address == beyondAll && size == 17 && info.protection == 42 && depth == 5);
        walk(port.name());
    }
}

/// Asks everything of a task that has ended; each call says so.
void expectDead(mach_port_t task) {
    std::uint64_t address = 0;
    std::uint64_t size = 0;
    std::uint64_t count = 1;
    std::vector<std::int32_t> words(1);
    vm_region_basic_info_64 basic;
    EXPECT_EQ(mach_vm_region(task, &address, &size, &basic), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(regionAt(task, 0).status, KERN_INVALID_ARGUMENT);
    EXPECT_EQ(mach_vm_page_range_query(task, 0x1000, 0x1000, words, &count), KERN_INVALID_ARGUMENT);
    int state = VM_PURGABLE_DENY;
    mach_vm_purgable_get_state(task, 0x1000, &state); // need not fail, but knows nothing
    EXPECT_EQ(state, VM_PURGABLE_DENY);
}

TEST_F(Contract, ADeadTaskIsToldApart) {
    const PortRight port = portOf(pid);
    environment->leaveSubjectAsZombie();
    expectDead(port.name());
    expectDead(portOf(pid).name());
    proc_bsdinfo info;
    proc_bsdshortinfo brief;
    ASSERT_EQ(proc_pidinfo(pid, &info), 136);
    ASSERT_EQ(proc_pidinfo(pid, &brief), 64);
    EXPECT_EQ(info.pbi_status, SZOMB);
    EXPECT_EQ(brief.pbsi_status, SZOMB);

    environment->endSubject();
    expectDead(port.name());
    EXPECT_EQ(proc_pidinfo(pid, &info), 0);
    EXPECT_EQ(proc_pidinfo(pid, &brief), 0);
    EXPECT_EQ(errno, ESRCH);
    expectDead(MACH_PORT_NULL);
}

TEST_F(Contract, AnUnknownPidIsRefused) {
    for (const std::int32_t unknown : {noSuchPid, -1}) {
        SCOPED_TRACE(unknown);
        proc_bsdinfo info;
        proc_bsdshortinfo brief;
        rusage_info_v5 usage;
        std::uint32_t flags = 42;
        std::vector<ledger_entry_info> entries(80);
        std::vector<char> area(4096);
        const auto expectNoProcess = [](std::ptrdiff_t result, std::ptrdiff_t refusal) {
            EXPECT_EQ(result, refusal);
            EXPECT_EQ(errno, ESRCH);
            errno = 0;
        };
        expectNoProcess(proc_pidinfo(unknown, &info), 0);
        expectNoProcess(proc_pidinfo(unknown, &brief), 0);
        expectNoProcess(proc_pid_rusage(unknown, &usage), -1);
        expectNoProcess(ledger_entries(unknown, entries), -1);
        expectNoProcess(sysctl_procargs2(unknown, area), -1);
        proc_get_dirty(unknown, &flags);
        EXPECT_LE(proc_regionfilename(unknown, 0x1000, area), 0);
        mach_port_t task = 99;
        EXPECT_EQ(task_read_for_pid(unknown, &task), KERN_FAILURE);
        EXPECT_EQ(task, MACH_PORT_NULL);
    }
}

TEST_F(Contract, AllProcessesAreListedInOrder) {
    const int count = proc_listallpids({});
    ASSERT_GT(count, 1);
    std::vector<std::int32_t> pids(count + 100, -7);
    const int listed = proc_listallpids(pids);
    ASSERT_GT(listed, 1);
    ASSERT_LE(static_cast<std::size_t>(listed), pids.size());
    EXPECT_TRUE(
        std::all_of(pids.begin() + listed, pids.end(), [](auto untouched) { return untouched == -7; }));
    pids.resize(listed);
    EXPECT_TRUE(std::is_sorted(pids.begin(), pids.end(), std::less_equal<>())) << "no pid twice";
    EXPECT_TRUE(std::binary_search(pids.begin(), pids.end(), ownPid()));
    EXPECT_TRUE(std::binary_search(pids.begin(), pids.end(), pid));
    std::vector<std::int32_t> little(1);
    EXPECT_EQ(proc_listallpids(little), 1);
    EXPECT_EQ(little[0], pids[0]);
}

TEST_F(Contract, AProcessTellsWhoItIs) {
    proc_bsdinfo info;
    proc_bsdshortinfo brief;
    ASSERT_EQ(proc_pidinfo(pid, &info), 136);
    ASSERT_EQ(proc_pidinfo(pid, &brief), 64);
    EXPECT_EQ(info.pbi_pid, pid);
    EXPECT_EQ(brief.pbsi_pid, pid);
    EXPECT_EQ(brief.pbsi_ppid, info.pbi_ppid);
    EXPECT_NE(brief.pbsi_status, SZOMB);
    EXPECT_EQ(info.pbi_flags & (PROC_FLAG_SYSTEM | PROC_FLAG_LP64), PROC_FLAG_LP64);
    EXPECT_EQ(std::memcmp(info.pbi_comm, brief.pbsi_comm, sizeof info.pbi_comm), 0);

    std::uint64_t room = 0;
    ASSERT_EQ(sysctl_argmax(&room), 0);
    ASSERT_GT(room, 64);
    std::vector<char> area(room);
    const std::ptrdiff_t length = sysctl_procargs2(pid, area);
    ASSERT_GT(length, 5);
    ASSERT_LE(static_cast<std::size_t>(length), room);
    EXPECT_EQ(area[4], '/') << "the executable's path stands behind the count";
    EXPECT_NE(std::memchr(area.data() + 4, '\0', length - 4), nullptr);
    std::vector<char> little(6, '#');
    EXPECT_LE(sysctl_procargs2(pid, std::span(little).first(5)), 5);
    EXPECT_EQ(little[5], '#');
}

TEST_F(Contract, FileNamesAreCutToTheBuffer) {
    const PortRight port = portOf(pid); // names are asked in the course of a walk
    for (const KnownMapping& known : environment->knownMappings()) {
        SCOPED_TRACE(known.file);
        std::vector<char> buffer(1024, '#');
        const int length = proc_regionfilename(pid, known.start, buffer);
        if (known.file.empty()) {
            EXPECT_LE(length, 0);
            continue;
        }
        ASSERT_EQ(length, static_cast<int>(known.file.size()));
        EXPECT_EQ(std::string_view(buffer.data(), length), known.file);
        EXPECT_EQ(buffer[length], '#') << "no NUL";
        std::vector<char> little(4, '#');
        EXPECT_EQ(proc_regionfilename(pid, known.start, std::span(little).first(3)), 3);
        EXPECT_EQ(std::string_view(little.data(), 4), known.file.substr(0, 3) + "#");
    }
}

TEST_F(Contract, LedgersFollowTheirTemplate) {
    std::vector<ledger_template_info> layout(80);
    const int defined = ledger_template(layout);
    ASSERT_GE(defined, 2);
    ASSERT_LE(defined, 80);
    std::vector<ledger_entry_info> entries(80);
    ASSERT_EQ(ledger_entries(pid, entries), defined);
    EXPECT_EQ(ledger_template(std::span(layout).first(1)), 1);
    std::vector<ledger_entry_info> little(1);
    EXPECT_EQ(ledger_entries(pid, little), 1);
    const auto balance = [&](std::string_view name) {
        for (int i = 0; i < defined; ++i) {
            if (std::string_view(layout[i].lti_name) == name) {
                return entries[i].lei_balance;
            }
        }
        return std::int64_t{-1};
    };
    EXPECT_GT(balance("page_table"), 0);
    rusage_info_v5 usage;
    ASSERT_EQ(proc_pid_rusage(pid, &usage), 0);
    EXPECT_EQ(balance("phys_tally"), static_cast<std::int64_t>(usage.ri_phys_tally));
    EXPECT_GE(usage.ri_lifetime_max_phys_tally, usage.ri_phys_tally);
}

TEST_F(Contract, TheAccountingSwitchIsRememberedAndNoOtherIsThere) {
    for (const std::int32_t value : {1, 0}) {
        ASSERT_EQ(sysctlbyname_write("vm.self_region_tally", value), 0);
        std::int32_t read = 42;
        ASSERT_EQ(sysctlbyname_read("vm.self_region_tally", &read), 0);
        EXPECT_EQ(read, value);
        EXPECT_EQ(sysctlbyname_read("vm.no_such_entry", &read), -1);
        EXPECT_EQ(errno, ENOENT);
        EXPECT_EQ(sysctlbyname_write("vm.no_such_entry", value), -1);
        EXPECT_EQ(errno, ENOENT);
    }
}

TEST_F(Contract, APortLivesAsLongAsItsReferences) {
    mach_port_t task = MACH_PORT_NULL;
    ASSERT_EQ(task_read_for_pid(pid, &task), KERN_SUCCESS);
    ASSERT_EQ(mach_port_retain(task), KERN_SUCCESS);
    ASSERT_EQ(mach_port_deallocate(task), KERN_SUCCESS);
    EXPECT_EQ(regionAt(task, 0).status, KERN_SUCCESS);
    EXPECT_FALSE(task_has_relatives(portOf(pid).name())) << "a process is none of its own";
    EXPECT_TRUE(task_has_relatives(MACH_PORT_NULL)) << "as far as can be told";
    {
        const GatherScope gather;
        EXPECT_EQ(regionAt(task, 0).status, KERN_SUCCESS);
    }
    task_take_notices(task);
    EXPECT_TRUE(task_take_notices(task).of_task.empty()) << "a notice is told once";
    ASSERT_EQ(mach_port_deallocate(task), KERN_SUCCESS);
    EXPECT_EQ(regionAt(task, 0).status, KERN_INVALID_ARGUMENT);
    EXPECT_NE(mach_port_retain(task), KERN_SUCCESS);
    EXPECT_NE(mach_port_deallocate(task), KERN_SUCCESS);
}

TEST_F(Contract, ClocksRise) {
    mach_times first;
    mach_times second;
    ASSERT_EQ(mach_get_times(&first), 0);
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    ASSERT_EQ(mach_get_times(&second), 0);
    EXPECT_GT(second.absolute_ticks, first.absolute_ticks);
    EXPECT_GT(second.continuous_ticks, first.continuous_ticks);
    EXPECT_TRUE(second.wall_seconds > 0 && second.wall_nanoseconds < 1'000'000'000);
    mach_timebase timebase;
    mach_timebase_info(&timebase);
    EXPECT_TRUE(timebase.numer > 0 && timebase.denom > 0);
}

TEST_F(Contract, AnApplyRunsEveryIndexOnce) {
    for (const std::size_t count : {0, 1, 2, 1000}) {
        SCOPED_TRACE(count);
        std::vector<std::atomic<int>> runs(count);
        std::atomic<std::size_t> highest = 0;
        std::atomic<bool> inOrder = true;
        const std::size_t processors = std::max(1U, std::thread::hardware_concurrency());
        dispatch_apply(count, {.label = "contract"}, [&](std::size_t index) {
            ++runs[index];
            // Every lower index has been handed out, and at most one per other processor has not come here.
            std::size_t seen = highest;
            inOrder = inOrder && index <= seen + processors;
            while (seen < index && !highest.compare_exchange_weak(seen, index)) {
            }
        });
        EXPECT_TRUE(std::all_of(runs.begin(), runs.end(), [](const auto& times) { return times == 1; }));
        EXPECT_TRUE(inOrder);
    }
    std::thread::id only;
    dispatch_apply(1, {}, [&](std::size_t) { only = std::this_thread::get_id(); });
    EXPECT_EQ(only, std::this_thread::get_id());
}

TEST_F(Contract, ASignalSourceTakesInterruptsUntilItIsCancelled) {
    for (const InterruptSignals which : {InterruptSignals::sigint, InterruptSignals::sigintAndTermination}) {
        std::atomic<int> interrupts = 0;
        Semaphore called;
        const auto source = dispatch_source_interrupt(which, [&] {
            ++interrupts;
            called.signal();
        });
        ASSERT_NE(source, nullptr);
        environment->interrupt();
        called.wait();
        if (which == InterruptSignals::sigint) {
            environment->interrupt();
        } else {
            environment->terminate();
        }
        called.wait();
        source->cancel();
        source->cancel(); // again is nothing new
        environment->interrupt();
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        EXPECT_EQ(interrupts, 2);
    }
    restoreDefaultInterruptAction();
}

} // namespace
} // namespace tally::platform
