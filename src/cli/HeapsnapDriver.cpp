#include "cli/HeapsnapDriver.h"

#include "analysis/TLTally.h"
#include "base/Format.h"
#include "cli/OptionScanner.h"
#include "cli/OutputFiles.h"
#include "platform/output_file.h"
#include "platform/quarry.h"
#include "platform/system.h"
#include "process/SnapshotCapture.h"
#include "process/TargetSelection.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

namespace tally {

using namespace platform;

namespace {

constexpr const char* usage =
    "Write a snapshot of a process's memory, to be analyzed later with tally\n"
    "Usage: heapsnap [--vmObjectDirty] [-o FILE] PID|NAME\n"
    "    -h, --help            print this output\n"
    "    -o, --output <file>   where to write it (default: NAME-PID.heapsnap)\n"
    "    --vmObjectDirty       calculate dirty memory from the VM objects' perspective\n";

struct HeapsnapArgs {
    bool wantsHelp = false;
    bool vmObjectDirty = false;
    std::string file; // empty: named after the process
    std::string target;
};

/// Absent for a command line that is none.
std::optional<HeapsnapArgs> parse(int argc, char** argv) {
    constexpr int vmObjectDirty = 0x100;
    constexpr std::array options = {option{"help", no_argument, nullptr, 'h'},
                                    option{"output", required_argument, nullptr, 'o'},
                                    option{"vmObjectDirty", no_argument, nullptr, vmObjectDirty}, option{}};
    HeapsnapArgs args;
    beginOptionScan();
    for (int letter = 0; (letter = nextOption(argc, argv, ":ho:", options.data())) != -1;) {
        switch (letter) {
        case 'h':
            args.wantsHelp = true;
            return args;
        case 'o':
            args.file = optarg;
            break;
        case vmObjectDirty:
            args.vmObjectDirty = true;
            break;
        default:
            return std::nullopt;
        }
    }
    if (optind + 1 != argc) {
        return std::nullopt;
    }
    args.target = argv[optind];
    return args;
}

/// The one process that `text` describes; absent, with a message, when there is none or more.
std::optional<std::int32_t> findProcess(const std::string& text) {
    std::vector<std::string> errors;
    TLTargetPids matches = pidsForStringDescriptions({&text, 1}, &errors).value_or(TLTargetPids());
    matches.erase(ownPid());
    if (matches.size() == 1) {
        return matches.begin()->first;
    }
    if (matches.empty()) {
        printLineToStandardError(errors.empty() ? "Unable to find pid for process matching '" + text + "'"
                                                : errors.front());
        return std::nullopt;
    }
    std::string pids;
    for (const auto& [pid, name] : matches) {
        pids += " " + std::to_string(pid);
    }
    printLineToStandardError("Several processes match '" + text + "', name one by its pid:" + pids);
    return std::nullopt;
}

/// The process of `pid`, ready to be gathered; null, with a message, when it cannot be read.
std::shared_ptr<SnapshotCapture> openProcess(std::int32_t pid) {
    proc_bsdinfo info;
    if (proc_pidinfo(pid, &info) == sizeof info && (info.pbi_flags & PROC_FLAG_SYSTEM) != 0) {
        std::fputs("The kernel has no address space to take a snapshot of\n", stderr);
        return nullptr;
    }
    auto process = std::make_shared<SnapshotCapture>();
    if (proc_pidinfo(pid, &info) != sizeof info || !process->initWithBsdInfo(info)) {
        std::fprintf(stderr, "Unable to analyze process with pid %d (try as root?)\n", pid);
        return nullptr;
    }
    return process;
}

/// Gathers the process. @return whether it could be read; what went wrong is on standard error.
bool gather(const std::shared_ptr<SnapshotCapture>& process) {
    TLTally({process}).gatherAllProcesses();
    for (const std::string& warning : process->warnings()) {
        printLineToStandardError("WARNING: " + warning);
    }
    for (const std::string& error : process->errors()) {
        printLineToStandardError(error);
    }
    return process->isComplete();
}

/// "NAME-PID.heapsnap"; names of processes can hold anything.
std::string defaultFile(const TLProcess& process) {
    std::string name = printable(process.name());
    std::ranges::replace(name, '/', '_');
    return name + "-" + std::to_string(process.pid()) + ".heapsnap";
}

bool writeFile(const std::string& path, const std::string& contents) {
    const std::unique_ptr<OutputFile> file = OutputFile::open(path);
    int error = errno;
    if (file) {
        file->write(contents);
        error = file->close();
    }
    if (file && error == 0) {
        return true;
    }
    printLineToStandardError("Unable to write " + path + ": " + std::generic_category().message(error));
    if (file) {
        file->discard(); // half a snapshot is of no use
    }
    return false;
}

} // namespace

int runHeapsnap(int argc, char** argv) {
    prepareOwnProcess();
    const std::optional<HeapsnapArgs> args = parse(argc, argv);
    if (!args || args->wantsHelp) {
        std::fputs(usage, args ? stdout : stderr);
        return args ? 0 : 1;
    }
    if (const std::string lack = whatMeasuringLacks(); !lack.empty()) {
        printLineToStandardError(lack);
        return 1;
    }
    TLTally::setPhysTallyCollectionEnabled(args->vmObjectDirty ? 0 : 1);
    const std::optional<std::int32_t> pid = findProcess(args->target);
    const std::shared_ptr<SnapshotCapture> process = pid ? openProcess(*pid) : nullptr;
    if (!process || !gather(process)) {
        return 1;
    }
    const std::string contents = QRYDataWithSnapshot(process->takeSnapshot());
    if (contents.size() > QRYLargestSnapshotFile) {
        std::fputs("The process has too many regions for a heapsnap file\n", stderr);
        return 1;
    }
    const std::string path = args->file.empty() ? defaultFile(*process) : args->file;
    if (processThatMaps(path, {{process}})) {
        printLineToStandardError(process->displayString() + " maps " + path + ", which is not written");
        return 1;
    }
    if (!writeFile(path, contents)) {
        return 1;
    }
    std::printf("%s\n", printable(path).c_str());
    return 0;
}

} // namespace tally
