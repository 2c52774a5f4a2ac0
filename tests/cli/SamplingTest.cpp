#include "cli/Sampling.h"
#include "analysis/TLTally.h"
#include "cli/CommandLine.h"
#include "cli/ParseArguments.h"
#include "platform/dispatch.h"
#include "platform/scripted/ScriptedKernel.h"
#include "process/TLProcess.h"

#include <algorithm>
#include <set>
#include <thread>

namespace tally {
namespace {

using Pids = std::vector<std::int32_t>;

/// Keeps what each sample told, and can be held at the start of one.
struct Recorder final : TLOutputFormatter {
    struct Sample {
        Pids pids; // in display order
        std::uint64_t dirty = 0;
        std::vector<std::string> globalErrors;
    };
    std::vector<Sample> samples;
    bool isMultiple = false;
    bool supportsMultiple = true;
    std::set<std::size_t> held; // numbers of samples that wait for `gate`
    platform::Semaphore reached, gate;

    const char* className() const override { return "Recorder"; }
    bool supportsMultipleOutputs() const override { return supportsMultiple; }
    void configureForMultipleOutputs() override { isMultiple = true; }
    void startAtTime(const std::optional<TLTime>& /*time*/) override {
        samples.emplace_back();
        reached.signal();
        if (held.contains(samples.size())) {
            gate.wait();
        }
    }
    void printProcessHeader(const TLProcess& process) override {
        samples.back().pids.push_back(process.pid());
    }
    void endProcessHeader(const TLProcess& /*process*/) override {}
    void printProcessTotal(std::optional<std::uint64_t> /*total*/, const TLProcess& /*process*/) override {}
    void printProcessCategories(const Categories& /*categories*/, const TLMemoryTotals& /*total*/) override {}
    void printSharedCategories(const Categories& /*categories*/, const TLProcessGroup& /*sharedWith*/,
                               const TLProcess& /*process*/, bool /*hasProcessView*/,
                               const TLMemoryTotals& /*total*/) override {}
    void printProcessAuxData(const std::optional<TLAuxDictionary>& /*auxData*/) override {}
    void printProcessesWithWarnings(const Processes& /*warnings*/, const Processes& /*errors*/,
                                    const std::vector<std::string>& globalErrors) override {
        samples.back().globalErrors = globalErrors;
    }
    void printSummaryCategories(const Categories& /*categories*/, const TLMemoryTotals& total,
                                bool /*hadErrors*/) override {
        samples.back().dirty = total.dirty;
    }
    void printGlobalAuxData(const std::optional<TLAuxDictionary>& /*auxData*/) override {}
    void endAtTime(const std::optional<TLTime>& /*time*/) override {}
};

class ThreadSampling : public testing::Test {
  protected:
    ThreadSampling() {
        TLTally::setPhysTallyCollectionEnabled(1);
        outputs.add(recorder);
        args.sampleInterval = 1;
        args.potentialTargetProcesses = {"server"};
    }

    platform::ScriptedTask& addServer(std::int32_t pid, std::uint64_t charged = 4096) {
        auto& task = kernel.addTask({.pid = pid, .name = "server", .usage = {.ri_phys_tally = charged}});
        task.map({.start = 0x1000, .pages = "DD"});
        return task;
    }

    /// Samples while `script` fires the timer on a thread of its own; then interrupts, unless that was done.
    /// @return what went to standard error.
    std::string sampleWhile(const std::function<void()>& script) {
        return written([&] {
                   const std::size_t runs = kernel.callCount("dispatch_source_interrupt");
                   std::thread director([&] {
                       kernel.awaitCall("dispatch_source_interrupt", runs + 1);
                       script();
                       kernel.interrupt();
                   });
                   EXPECT_TRUE(runSampling(args, outputs));
                   director.join();
               })
            .second;
    }

    /// How often `pid` was gathered.
    std::size_t walks(std::int32_t pid) const { return kernel.callCount("task_take_notices", pid); }

    void expectSamples(const std::vector<Pids>& expected) const {
        std::vector<Pids> found;
        for (const Recorder::Sample& sample : recorder->samples) {
            found.push_back(sample.pids);
            std::ranges::sort(found.back());
        }
        EXPECT_EQ(found, expected);
    }

    platform::ScriptedKernel kernel;
    TLTallyArgs args;
    OutputFiles outputs;
    const std::shared_ptr<Recorder> recorder = std::make_shared<Recorder>();
};

bool holds(const std::string& text, const std::string& part) { return text.find(part) != text.npos; }

TEST_F(ThreadSampling, StretchesTheIntervalFromTheSecondMissOn) {
    addServer(7);
    const struct {
        double at; // seconds
        std::uint64_t ticks;
        const char* warned; // the new interval
    } steps[] = {{0, 1, nullptr},  {3, 3, nullptr}, {6.5, 3, "3.75"},
                 {10, 2, nullptr}, {30, 2, "21.6"}, {31, 1, nullptr}};
    std::string expected = "Sampling at 1s interval... (<ctrl-c> to stop)\n";
    const std::string messages = sampleWhile([&] {
        for (const auto& step : steps) {
            kernel.uptimeNanoseconds = static_cast<std::uint64_t>(step.at * 1e9);
            EXPECT_TRUE(kernel.fireTimer(step.ticks));
        }
    });
    std::vector<std::vector<std::uint64_t>> settings;
    for (const platform::CallRecord& call : kernel.calls()) {
        if (call.name == "setTimer") {
            settings.push_back(call.arguments);
        }
    }
    // 1 s + 1.1 * (3.5 s - 1 s); then + 1.1 * (20 s - 3.75 s)
    EXPECT_EQ(settings,
              (std::vector<std::vector<std::uint64_t>>{{0, 1'000'000'000, 500'000'000},
                                                       {3'750'000'000, 3'750'000'000, 500'000'000},
                                                       {21'625'000'000, 21'625'000'000, 500'000'000}}));
    for (const auto& step : steps) {
        if (step.warned != nullptr) {
            const std::string warning =
                "WARNING: Unable to keep up with sampling interval. Increasing interval to ";
            EXPECT_TRUE(holds(messages, warning + step.warned + "s.\n")) << messages;
        }
    }
    expectSamples(std::vector<Pids>(std::size(steps), Pids{7})); // a late sample is one all the same
    EXPECT_TRUE(recorder->isMultiple);
}

TEST_F(ThreadSampling, TakesAnyInterval) {
    constexpr std::uint64_t most = ~std::uint64_t{0};
    const struct {
        std::string words;
        std::uint64_t interval, leeway;
        const char* shown;
    } cases[] = {{"--sample 0.5s", 500'000'000, 250'000'000, "0.5"},
                 {"--sample \t+0.0123456", 12'345'600, 6'172'800, "0.0123"},
                 {"--sample 2.2250738585072014e-308", 0, 0, "2.23e-308"},
                 {"--sample 1e300", most, 500'000'000, "1e+300"}};
    for (const auto& expected : cases) {
        platform::CallRecord setting;
        CommandLine line(expected.words);
        args = std::get<TLTallyArgs>(parseArguments(line.argc(), line.argv()));
        const std::string messages = sampleWhile([&] {
            setting = *std::ranges::find(kernel.calls().rbegin(), kernel.calls().rend(), "setTimer",
                                         &platform::CallRecord::name);
        });
        EXPECT_EQ(setting.arguments, (std::vector<std::uint64_t>{0, expected.interval, expected.leeway}));
        EXPECT_TRUE(holds(messages, std::string("Sampling at ") + expected.shown + "s interval... "));
    }
}

TEST_F(ThreadSampling, ResolvesTheTargetsAnewEachTime) {
    addServer(7);
    const std::string messages = sampleWhile([&] {
        kernel.fireTimer();
        addServer(8);
        kernel.fireTimer();
        kernel.findTask(7)->exit();
        kernel.fireTimer();
        kernel.findTask(8)->exit();
        kernel.fireTimer();
    });
    expectSamples({{7}, {7, 8}, {8}, {}});
    const std::string gone = "Unable to analyze process server [7] (try as root?)\n";
    EXPECT_EQ(messages.find(gone, messages.find(gone) + 1), messages.rfind(gone)); // in two samples
    EXPECT_NE(messages.find(gone), messages.rfind(gone));

    recorder->samples.clear();
    args.targetPids.clear();
    args.potentialTargetProcesses.clear(); // as when nothing but snapshot files was named
    sampleWhile([&] { kernel.fireTimer(); });
    expectSamples({{}});
}

TEST_F(ThreadSampling, CarriesOverWhatIsUnchangedWhileTheLastSampleLives) {
    enum : std::int32_t { same = 10, grown, parent, child, unknown, owner, renamed, peer };
    for (std::int32_t pid = same; pid <= peer; ++pid) {
        addServer(pid, pid == unknown ? 0 : 4096);
    }
    kernel.findTask(parent)->family = kernel.findTask(child)->family = 1;
    kernel.findTask(owner)->owned = {{.id = 99, .virtualSize = 4096, .residentSize = 4096}};
    // Of the four pages of one object each has two: 4 together, though counts alone would say 2.
    kernel.findTask(same)->map({.start = 0x10000, .pages = "DD..", .object = 5});
    kernel.findTask(peer)->map({.start = 0x10000, .pages = "..DD", .object = 5});
    const std::map<std::int32_t, std::size_t> walksOfSecondSample = {
        {same, 0}, {grown, 1}, {parent, 1}, {child, 1}, {unknown, 1}, {owner, 1}, {renamed, 1}, {peer, 0}};
    recorder->held = {1};
    sampleWhile([&] {
        kernel.fireTimer();
        kernel.findTask(grown)->usage.ri_phys_tally = 8192;
        kernel.findTask(renamed)->name = "other"; // as after an exec
        kernel.findTask(renamed)->path = "/bin/other";
        recorder->reached.wait(); // the first analysis waits in its report
        kernel.fireTimer();
        for (const auto& [pid, count] : walksOfSecondSample) {
            EXPECT_EQ(walks(pid), 1 + count) << pid;
        }
        recorder->gate.signal();
        while (walks(same) == 1) { // once no earlier sample lives, everything is gathered afresh
            kernel.fireTimer();
        }
    });
    ASSERT_GE(recorder->samples.size(), 3U);
    for (const Recorder::Sample& sample : recorder->samples) {
        EXPECT_EQ(sample.pids.size(), 8U);
        EXPECT_EQ(sample.dirty, recorder->samples[0].dirty);
    }
    EXPECT_EQ(recorder->samples[0].dirty, (8 * 2 + 4 + 1) * 4096U);
}

TEST_F(ThreadSampling, DropsTheInterruptedSampleAndReportsAllBefore) {
    for (std::int32_t pid = 1; pid <= 60; ++pid) {
        addServer(pid);
    }
    recorder->held = {1};
    const std::string messages = sampleWhile([&] {
        kernel.fireTimer();
        recorder->reached.wait();
        for (std::int32_t pid = 2; pid <= 60; ++pid) { // the lowest pid, gathered last, is carried over
            kernel.findTask(pid)->usage.ri_phys_tally = 8192;
        }
        kernel.before("mach_vm_region_recurse", [&] { EXPECT_TRUE(kernel.interrupt()); });
        EXPECT_TRUE(kernel.fireTimer());
        EXPECT_EQ(walks(1), 1U);
        EXPECT_LT(walks(2), 2U); // its turn never came
        EXPECT_FALSE(kernel.fireTimer());
        kernel.awaitCall("restoreDefaultInterruptAction");
        EXPECT_FALSE(kernel.interrupt()); // a second one would end the program
        recorder->gate.signal();
    });
    ASSERT_EQ(recorder->samples.size(), 1U);
    EXPECT_EQ(recorder->samples[0].pids.size(), 60U);
    EXPECT_EQ(recorder->samples[0].globalErrors, std::vector<std::string>());
    EXPECT_TRUE(messages.ends_with("\nStopping...\nAnalyzing and writing output...\n")) << messages;
}

TEST_F(ThreadSampling, WaitsForReportsInsteadOfKeepingSamplesWithoutEnd) {
    addServer(7);
    recorder->held = {1};
    for (const bool isInterrupted : {false, true}) { // while a sample waits for its place
        recorder->samples.clear();
        const std::size_t gathers = kernel.callCount("GatherScope");
        sampleWhile([&] {
            for (int i = 0; i < 16; ++i) {
                kernel.fireTimer();
            }
            const std::size_t begun = kernel.callCount("clock_uptime_raw_approx_ns");
            std::thread late([&] { kernel.fireTimer(); });
            kernel.awaitCall("clock_uptime_raw_approx_ns", begun + 1);
            EXPECT_EQ(kernel.callCount("GatherScope") - gathers, 16U);
            EXPECT_TRUE(!isInterrupted || kernel.interrupt());
            recorder->gate.signal();
            late.join();
        });
        EXPECT_EQ(recorder->samples.size(), isInterrupted ? 16U : 17U);
    }
}

TEST_F(ThreadSampling, EndsOnTerminationToo) {
    addServer(7);
    sampleWhile([&] {
        kernel.fireTimer();
        EXPECT_TRUE(kernel.terminate());
    });
    expectSamples({{7}});
    recorder->samples.clear();
    outputs.add(recorder, "a file");
    EXPECT_TRUE(holds(sampleWhile([] {}), "No sample was completed: files")); // before the first tick
    expectSamples({});
}

TEST_F(ThreadSampling, SaysWhatDoesNotSupportIt) {
    recorder->supportsMultiple = false;
    EXPECT_TRUE(
        holds(sampleWhile([] {}), "Selected output format (Recorder) does not support sampling mode\n"));
    EXPECT_FALSE(recorder->isMultiple);
    kernel.fail("dispatch_source_timer", EMFILE);
    const auto [output, messages] = written([&] { EXPECT_FALSE(runSampling(args, outputs)); });
    EXPECT_EQ(messages, "Unable to start sampling: Too many open files\n");
}

} // namespace
} // namespace tally
