#include "cli/GuardedMain.h"
#include "cli/RunDriver.h"

int main(int argc, char** argv) { return tally::guardedMain(tally::runTally, argc, argv); }
