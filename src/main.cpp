#include "cli/GuardedMain.h"
#include "cli/RunDriver.h"

#include <cstdlib>

int main(int argc, char** argv) {
    std::unique_ptr<tally::TLTally> gathered; // which exit() leaves to the end of the process
    const auto run = [&](int count, char** words) { return tally::runTally(count, words, gathered); };
    std::exit(tally::guardedMain(run, argc, argv));
}
