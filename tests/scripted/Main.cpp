// tally-scripted CASE RUN: the tool, or heapsnap, on the kernel that a case file writes down. RUN counts from
// 0.

#include "cli/HeapsnapDriver.h"
#include "cli/RunDriver.h"
#include "scripted/KernelFromCase.h"

#include <cstdio>
#include <exception>

int main(int argc, char** argv) {
    using namespace tally;
    if (argc != 3) {
        std::fputs("usage: tally-scripted CASE RUN\n", stderr);
        return 2;
    }
    try {
        const CaseFile file = CaseFile::read(argv[1]);
        const CaseRun& run = file.runs.at(std::stoul(argv[2]));
        std::vector<std::string> arguments = run.arguments;
        arguments.insert(arguments.begin(), run.isHeapsnap ? "heapsnap" : "tally");
        std::vector<char*> words;
        for (std::string& argument : arguments) {
            words.push_back(argument.data());
        }
        words.push_back(nullptr);
        platform::ScriptedKernel kernel;
        buildKernel(kernel, file.kernel);
        const int count = static_cast<int>(arguments.size());
        const int status = run.isHeapsnap ? runHeapsnap(count, words.data()) : runTally(count, words.data());
        if (kernel.heldPortReferences() != 0 || kernel.heldBuffers() != 0) {
            std::fputs("tally-scripted: the run kept ports or buffers\n", stderr);
            return 3;
        }
        return status;
    } catch (const std::exception& mistake) {
        std::fprintf(stderr, "tally-scripted: %s\n", mistake.what());
        return 2;
    }
}
