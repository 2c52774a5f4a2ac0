#include "platform/linux/corpse/Corpse.h"

#include "platform/linux/corpse/CorpseFamilies.h"
#include "platform/linux/corpse/KcdataWriter.h"
#include "platform/linux/corpse/StopSignals.h"
#include "platform/linux/corpse/StoppedThreads.h"
#include "platform/linux/images/SymbolOwners.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/machine/Charges.h"
#include "platform/linux/machine/MachineState.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/objects/Executable.h"
#include "platform/linux/objects/FilesAhead.h"
#include "platform/linux/objects/MapFiles.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <future>
#include <optional>
#include <system_error>
#include <thread>
#include <vector>

namespace tally::platform {

namespace {

/// Who the process is, as its crash information says it.
struct Identification {
    std::string path; // the link to the executable, or a name
    std::uint32_t flags = 0;
};

/// Absent on failure, with errno.
std::optional<Identification> identify(std::int32_t pid) {
    const std::optional<ProcessStat> stat = readProcessStat(pid);
    if (!stat) {
        return std::nullopt;
    }
    return Identification{.path = executableLink(pid).value_or(stat->comm),
                          .flags = is64bitProgram(*stat) ? crashFlag64bit : 0};
}

std::vector<std::byte> crashInformationOf(std::int32_t pid, const Identification& identification,
                                          const Charges& charges) {
    KcdataWriter writer;
    writer.addNumber(crashPid, static_cast<std::uint32_t>(pid));
    writer.addText(crashPath, executablePath(pid, identification.path));
    writer.addNumber(crashFlags, identification.flags);
    writer.addNumber(crashDirtyFlags, std::uint32_t{0}); // nothing is tracked for idle exit here
    writer.addNumber(crashPageTable, charges.pageTable);
    writer.addNumber(crashPhysTally, charges.physTally);
    writer.addNumber(crashPhysTallyPeak, charges.peak);
    return writer.finish();
}

/// Whether another process can descend from the same exec. Who will be asked for later is not known yet.
bool canHaveLiveRelatives(std::int32_t pid, const FamilyKey& key) {
    const auto pids = listNumbered(systemPath("/proc"));
    return key.isKnown() && (!pids || std::ranges::any_of(*pids, [&](std::int32_t other) {
               const auto stat = readProcessStat(other);
               return other != pid && (stat ? familyKeyOf(*stat) == key : isRefusal(errno));
           }));
}

constexpr std::size_t mostOpened = 256; // smaps stands in for the others

/// Whether a walk asks the page cache of such a file which of its pages there are.
bool asksPages(Backing backing, const Mapping& mapping, View view) {
    return (backing == Backing::sharedMemory && (view == View::object || machineState().swapInUse)) ||
           (backing == Backing::file && (view == View::object || mapping.shared));
}

/// Asks of a running process's files what is needed of them, so that none is asked while the process holds
/// still.
FilesAhead askAhead(MemberIdentity task, View view) {
    FilesAhead ahead;
    ProcessMemoryFiles files;
    std::vector<Mapping> mappings;
    if (files.open(task.pid, task.startTicks, &mappings) != KERN_SUCCESS) {
        return ahead;
    }
    std::size_t opened = 0;
    for (const Mapping& mapping : mappings) {
        if (!mapping.isFileBacked()) {
            continue;
        }
        FilesAhead::Known& known = ahead.enter(mapping);
        if (known.object.backing == Backing::anonymous) { // new
            known.object = backingOf(mapping, files.folder);
        }
        if (asksPages(known.object.backing, mapping, view) && !known.file.isOpen() && opened < mostOpened) {
            known.file = openForPageStates(files.folder, mapping);
            ++opened;
        }
    }
    symbolOwnersOf(mappings, files.folder); // the headers of its files are remembered
    return ahead;
}

/// The images of a corpse, of files that were asked ahead; and of others as long as the process still maps
/// them.
void nameImages(CorpseSpace& space) {
    const NoteTaker taker(space.notices);
    space.images = symbolOwnersOf(space.walk->mappings(), space.walk->folder());
}

/// Why a file of a process's folder cannot be read; errno says it.
kern_return_t statusOfUnread() { return isRefusal(errno) ? KERN_FAILURE : KERN_TERMINATED; }

/// What is found out while the process holds still.
struct Capture {
    View view = View::charged;
    FilesAhead files;
    bool hasRelatives = false; // by which it is known what else to read
    std::optional<Identification> identification;
    Charges charges;
};

constexpr const char* unheldNotice = "What corpses of forked relatives share counts for each of them: its "
                                     "pages could not be read side by side";

/// Enters of what exec the process is. @return false when it is another process.
bool identifyProgram(MemberIdentity task, CorpseSpace& space, Capture& capture) {
    const std::optional<ProcessStat> stat = readProcessStat(task.pid);
    if (!stat || stat->startTicks != task.startTicks) {
        return false;
    }
    if (const FamilyKey key = familyKeyOf(*stat); key != space.key) { // it has loaded a program since
        space.key = key;
        space.execRandom = isLayoutFixed(task.pid) ? readExecRandom(task.pid) : decltype(space.execRandom){};
        capture.hasRelatives = true; // for all that is known
    }
    return true;
}

/// Looks at the process. To be run by a thread of its own, at whose end every thread of the process runs on.
kern_return_t lookAt(MemberIdentity task, SeizedThreads& seized, CorpseSpace& space, Capture& capture) {
    const FilesAhead::Use asksNoFile(capture.files);
    const StoppedThreads stopped(task.pid, seized);
    if (stopped.status() != KERN_SUCCESS) {
        return stopped.status();
    }
    if (!identifyProgram(task, space, capture)) {
        return KERN_TERMINATED;
    }
    space.owner = task;
    capture.identification = identify(task.pid);
    if (!capture.identification) {
        return statusOfUnread();
    }
    Walk::Result result = Walk::read(task, FamilyKey(), task, capture.view);
    const auto counted = result.walk ? result.walk->resident() : std::nullopt;
    capture.charges = readCharges(task.pid, false, counted).value_or(Charges());
    const kern_return_t status = result.walk ? result.walk->statusPastEnd() : result.status;
    if (status == KERN_INVALID_ARGUMENT || capture.charges.pageTable == 0) {
        return KERN_TERMINATED; // it can be killed while it holds still
    }
    if (!result.walk) {
        return status;
    }
    space.walk = std::move(result.walk);
    space.notices = std::move(result.notices);
    if (capture.hasRelatives) {
        const kern_return_t held = readHeldPages(task, space.walk->mappings(), &space.held);
        if (held == KERN_INVALID_ARGUMENT) {
            return KERN_TERMINATED;
        }
        if (held != KERN_SUCCESS) {
            space.notices.emplace_back(unheldNotice);
        }
    }
    return KERN_SUCCESS;
}

/// Runs `work` on a thread of its own, and `meanwhile` on this one again and again. Throws what `work`
/// throws.
/// @return KERN_NO_SPACE where the system refuses a thread.
template <typename Work, typename Meanwhile>
kern_return_t runApart(const Work& work, const Meanwhile& meanwhile) {
    std::packaged_task<kern_return_t()> task(work);
    std::future<kern_return_t> result = task.get_future();
    try {
        const StopSignals putOff;
        const std::jthread worker([&] { task(); });
        while (result.wait_for(std::chrono::milliseconds(2)) != std::future_status::ready) {
            meanwhile();
        }
    } catch (const std::system_error&) { // no thread is to be had
        return KERN_NO_SPACE;
    }
    return result.get();
}

} // namespace

const Walk* Corpse::walk() const {
    settleCorpseFamily(*space_);
    return space_->walk.get();
}

std::vector<std::string> Corpse::notices() const { return noticesOf(*space_); }

bool Corpse::hasRelatives() const { return !space_->key.isKnown() || countCorpses(space_->key) > 1; }

kern_return_t makeCorpse(MemberIdentity task, View view, std::shared_ptr<Corpse>* corpse) {
    const std::optional<ProcessStat> stat = readProcessStat(task.pid);
    const FamilyKey key = stat ? familyKeyOf(*stat) : FamilyKey();
    if (auto space = corpseSpaceOfTwin(key, task)) {
        const std::optional<Charges> charges = readCharges(task.pid, true, space->walk->resident());
        const std::optional<Identification> identification = charges ? identify(task.pid) : std::nullopt;
        if (!identification) {
            return statusOfUnread();
        }
        *corpse =
            std::make_shared<Corpse>(task, space, crashInformationOf(task.pid, *identification, *charges));
        return KERN_SUCCESS;
    }
    const auto space = std::make_shared<CorpseSpace>();
    space->key = key;
    if (isLayoutFixed(task.pid)) {
        space->execRandom = readExecRandom(task.pid);
    }
    Capture capture;
    capture.view = view;
    capture.hasRelatives = canHaveLiveRelatives(task.pid, key);
    capture.files = askAhead(task, view);
    SeizedThreads seized;
    const kern_return_t status =
        runApart([&] { return lookAt(task, seized, *space, capture); }, [&] { seized.takeNoteOfEnds(); });
    if (status == KERN_SUCCESS) {
        nameImages(*space);
        enterCorpse(space);
        *corpse = std::make_shared<Corpse>(
            task, space, crashInformationOf(task.pid, *capture.identification, capture.charges));
    }
    return status;
}

} // namespace tally::platform
