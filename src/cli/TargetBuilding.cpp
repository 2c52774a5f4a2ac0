#include "cli/TargetBuilding.h"

#include "base/Format.h"
#include "platform/mach_task.h"
#include "platform/system.h"
#include "process/TLCorpseProcess.h"
#include "process/TLUserProcess.h"

#include <cinttypes>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <system_error>
#include <utility>

namespace tally {

using namespace platform;

namespace {

/// What `texts` describe; nothing where the process list cannot be had, which is then one of the `errors`.
TLTargetPids resolved(const std::set<std::string>& texts, std::vector<std::string>* errors) {
    if (texts.empty()) { // not worth a list of all processes
        return {};
    }
    const std::vector<std::string> descriptions(texts.begin(), texts.end());
    return pidsForStringDescriptions(descriptions, errors).value_or(TLTargetPids());
}

/// One building of the table. A step that returns false has ended it, with `error_` as the reason.
class TargetBuilder {
  public:
    TargetBuilder(TLTallyArgs& args, bool says) : args_(args), says_(says) {}

    bool build();

    TLProcessTable takeTable() { return std::move(table_); }
    /// Why it failed, if that can be told.
    const std::optional<TLError>& error() const { return error_; }
    /// The strings that describe nothing.
    const std::optional<TLError>& unresolved() const { return unresolved_; }

  private:
    bool openSnapshots();
    bool openSnapshot(const std::string& path);
    bool adoptModeOfSnapshot(const std::string& path, bool breakDownPhysTally);
    bool targetOneProcess(const std::string& text);
    TLPidSet exclusionSet() const;
    bool targetEveryProcess(const TLPidSet& excluded);
    bool targetNamedProcesses(const TLPidSet& excluded);
    void resolveNames();
    bool addChildren();
    bool searchAllProcessesBut(TLPidSet excluded);
    std::optional<TLProcessTable> allReadableProcesses(const TLPidSet& excluded) const;
    bool canMeasure() const;
    void noticePidsNamedTwice() const;
    void notice(const std::string& text) const;
    std::shared_ptr<TLProcess> liveTarget(std::int32_t pid, const TLTargetName& name,
                                          const TLOpenedProcess& opened) const;

    bool failWithoutList() { return fail(TLErrorBadPid, "Unable to obtain system process list"); }
    bool fail(int code, std::string message) {
        error_ = TLError{TLTallyErrorDomain, code, std::move(message)};
        return false;
    }

    TLTallyArgs& args_;
    bool says_;                                    // notices
    std::map<std::int32_t, std::string> shadowed_; // notices by the pid that a file's name stood for
    TLProcessTable table_;
    std::optional<TLError> error_, unresolved_;
};

bool TargetBuilder::build() {
    if (!openSnapshots()) {
        return false;
    }
    if (args_.targetPids.empty() && args_.potentialTargetProcesses.empty() && table_.empty() &&
        !args_.targetAll) {
        return fail(TLErrorNoTargets, "Must specify at least one process or heapsnap");
    }
    if (!canMeasure()) { // snapshots are reported all the same
        return true;
    }
    const TLPidSet excluded = exclusionSet();
    if (!(args_.targetAll ? targetEveryProcess(excluded) : targetNamedProcesses(excluded))) {
        return false;
    }
    noticePidsNamedTwice();
    if (args_.skipIdleExitClean) {
        table_ = removeIdleExitCleanProcessesFrom(table_);
    }
    return true;
}

/// Whether the machine lets processes be measured, if there is one to measure; what it lacks is said.
bool TargetBuilder::canMeasure() const {
    if (args_.targetPids.empty() && args_.potentialTargetProcesses.empty() && !args_.targetAll) {
        return true; // snapshots need nothing of it
    }
    const std::string lack = whatMeasuringLacks();
    if (!lack.empty()) {
        notice(lack + "\n");
    }
    return lack.empty();
}

/// Reports go by pid: a process and its snapshot, or two snapshots of it, are one entry there.
void TargetBuilder::noticePidsNamedTwice() const {
    std::map<std::int32_t, std::string> names;
    for (const auto& [key, process] : table_) {
        const auto [entry, isNew] = names.try_emplace(process->pid(), process->displayString());
        if (!isNew) {
            notice(
                formatted("NOTICE: %s and %s have one pid: their sections and totals show the two together; "
                          "report on one at a time to tell them apart\n",
                          printable(entry->second).c_str(), printable(process->displayString()).c_str()));
        }
    }
}

/// What names a file is a snapshot or, failing that, a process.
bool TargetBuilder::openSnapshots() {
    const std::set<std::string> texts = args_.potentialTargetProcesses;
    for (const std::string& text : texts) {
        std::error_code ignored;
        if (std::filesystem::exists(text, ignored)) {
            if (!openSnapshot(text)) {
                return false;
            }
            args_.potentialTargetProcesses.erase(text);
        }
    }
    return true;
}

bool TargetBuilder::openSnapshot(const std::string& path) {
    std::optional<TLError> openError;
    const std::shared_ptr<TLProcess> snapshot = TLProcess::processWithFile(path, &openError);
    if (!snapshot) {
        return targetOneProcess(path) ||
               fail(TLErrorBadSnapshot,
                    formatted("Error opening heapsnap %s: %s", printable(path).c_str(),
                              openError ? printable(openError->message).c_str() : "unknown error"));
    }
    // A key that no pid has.
    table_[std::hash<std::string>()(path) | std::uint64_t{1} << 63] = snapshot;
    return adoptModeOfSnapshot(path, snapshot->breakDownPhysTally());
}

/// The first snapshot fixes the analysis mode, unless an option has; every other one must agree.
bool TargetBuilder::adoptModeOfSnapshot(const std::string& path, bool breakDownPhysTally) {
    if (args_.didSetShouldGetPhysTallyBreakdown && args_.shouldGetPhysTallyBreakdown != breakDownPhysTally) {
        return fail(TLErrorSnapshotConflict,
                    "Heapsnap was gathered with an analysis mode that conflicts with other heapsnaps or "
                    "command line arguments: " +
                        printable(path));
    }
    if (args_.searchForUnmapped) {
        return fail(TLErrorSnapshotConflict,
                    "--unmapped is not compatible with heapsnaps (" + printable(path) +
                        ").\nRemove the flag for best effort 'unmapped' analysis (which may be more than "
                        "other tools such as regionlist(1) but less than tally(1) analyzing a running "
                        "process).");
    }
    args_.shouldGetPhysTallyBreakdown = breakDownPhysTally;
    args_.didSetShouldGetPhysTallyBreakdown = true;
    return true;
}

/// Targets one process that `text`, the name of a file as well, describes.
bool TargetBuilder::targetOneProcess(const std::string& text) {
    const TLTargetPids matches = resolved({text}, nullptr);
    if (matches.empty()) {
        return false;
    }
    const auto& [pid, name] = *matches.begin();
    shadowed_[pid] =
        formatted("NOTICE: '%s' is also a file here; taken for process %d", printable(text).c_str(), pid);
    if (matches.size() > 1) {
        shadowed_[pid] += formatted(", one of %zu that match (use --pid for the others)", matches.size());
    }
    shadowed_[pid] += '\n';
    args_.targetPids[pid] = name;
    return true;
}

TLPidSet TargetBuilder::exclusionSet() const {
    TLPidSet excluded;
    if (args_.excludeSelf) {
        excluded.insert(ownPid());
    }
    for (const auto& [pid, name] : resolved(args_.excludedPidsOrProcesses, nullptr)) {
        excluded.insert(pid);
    }
    return excluded;
}

bool TargetBuilder::targetEveryProcess(const TLPidSet& excluded) {
    auto processes = allReadableProcesses(excluded);
    if (!processes) {
        return failWithoutList();
    }
    table_ = *std::move(processes);
    return true;
}

/// Every process but `excluded`; what may not be read is said in one line.
std::optional<TLProcessTable> TargetBuilder::allReadableProcesses(const TLPidSet& excluded) const {
    TLUnreadableProcesses unreadable;
    auto processes = allProcessesExcludingPids(excluded, &unreadable);
    if (unreadable.count != 0) {
        notice(formatted("NOTICE: processes that could not be read and are left out: %zu (with %" PRIu64
                         " bytes of resident anonymous memory)\n",
                         unreadable.count, unreadable.residentAnonymous));
    }
    return processes;
}

/// Says something of the whole run; a sample, whose targets are built again and again, says it no more.
void TargetBuilder::notice(const std::string& text) const {
    if (says_) {
        std::fputs(text.c_str(), stderr);
    }
}

bool TargetBuilder::targetNamedProcesses(const TLPidSet& excluded) {
    resolveNames();
    std::erase_if(args_.targetPids, [&](const auto& target) { return excluded.contains(target.first); });
    for (const auto& [pid, text] : shadowed_) {
        if (args_.targetPids.contains(pid)) {
            notice(text);
        }
    }
    // After the exclusions: an excluded process that descends from a target is one again.
    if (args_.targetChildren && !addChildren()) {
        return false;
    }
    if (args_.searchForUnmapped && !searchAllProcessesBut(excluded)) {
        return false;
    }
    std::vector<std::int32_t> pids;
    for (const auto& [pid, name] : args_.targetPids) {
        pids.push_back(pid);
    }
    const std::vector<TLOpenedProcess> opened = openProcesses(pids);
    auto next = opened.begin();
    for (const auto& [pid, name] : args_.targetPids) {
        if (auto process = liveTarget(pid, name, *next++)) {
            table_[static_cast<std::uint64_t>(pid)] = std::move(process);
        }
    }
    return true;
}

/// Targets what the remaining strings describe. Those that describe nothing end nothing.
void TargetBuilder::resolveNames() {
    std::vector<std::string> errors;
    for (const auto& [pid, name] : resolved(args_.potentialTargetProcesses, &errors)) {
        args_.targetPids[pid] = name;
    }
    if (!errors.empty()) {
        std::string message;
        for (const std::string& error : errors) {
            message += (message.empty() ? "" : "\n") + printable(error);
        }
        unresolved_ = TLError{TLTallyErrorDomain, TLErrorBadPid, std::move(message)};
    }
}

bool TargetBuilder::addChildren() {
    std::vector<std::int32_t> targets;
    for (const auto& [pid, name] : args_.targetPids) {
        targets.push_back(pid);
    }
    const auto family = childPidsForPids(targets);
    if (!family) {
        return failWithoutList();
    }
    for (const std::int32_t pid : *family) {
        args_.targetPids[pid] = std::nullopt;
    }
    return true;
}

/// Starts the table with all processes but the targets, `excluded` and the kernel: searched, not shown.
bool TargetBuilder::searchAllProcessesBut(TLPidSet excluded) {
    for (const auto& [pid, name] : args_.targetPids) {
        excluded.insert(pid);
    }
    excluded.insert(0);
    auto processes = allReadableProcesses(excluded);
    if (!processes) {
        return failWithoutList();
    }
    for (const auto& [pid, process] : *processes) {
        process->setHiddenFromDisplay(true);
    }
    table_ = *std::move(processes);
    return true;
}

/// The process of a targeted pid, or its corpse; null when there is none.
std::shared_ptr<TLProcess> TargetBuilder::liveTarget(std::int32_t pid, const TLTargetName& name,
                                                     const TLOpenedProcess& opened) const {
    std::shared_ptr<TLProcess> process = opened.process;
    if (!process) {
        if (opened.refusal != KERN_SUCCESS) {
            mach_error("task_read_for_pid", opened.refusal);
        }
        if (name) {
            std::fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n",
                         printable(*name).c_str(), long{pid});
        } else {
            std::fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", long{pid});
        }
        return nullptr;
    }
    const auto* live = dynamic_cast<const TLUserProcess*>(process.get());
    if (!args_.forkCorpse || live == nullptr) {
        return process;
    }
    mach_port_t corpse = MACH_PORT_NULL;
    if (const kern_return_t status = task_generate_corpse(live->task(), &corpse); status != KERN_SUCCESS) {
        std::fprintf(stderr, "Unable to fork a corpse of process %s [%d]: %s\n",
                     printable(process->name()).c_str(), pid, mach_error_string(status));
        return nullptr;
    }
    const PortRight ours(corpse); // the corpse process takes a right of its own
    return TLCorpseProcess::initWithCorpse(corpse);
}

} // namespace

std::optional<TLProcessTable> targetProcessesForArgs(TLTallyArgs& args, std::optional<TLError>* error) {
    TargetBuilder builder(args, error != nullptr);
    const bool built = builder.build();
    if (error != nullptr) {
        *error = built ? builder.unresolved() : builder.error();
    }
    return built ? std::optional(builder.takeTable()) : std::nullopt;
}

std::vector<std::shared_ptr<TLProcess>> processesOf(const TLProcessTable& table) {
    std::vector<std::shared_ptr<TLProcess>> processes;
    processes.reserve(table.size());
    for (const auto& [key, process] : table) {
        processes.push_back(process);
    }
    return processes;
}

} // namespace tally
