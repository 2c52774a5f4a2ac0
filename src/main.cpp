#include "cli/RunDriver.h"

int main(int argc, char** argv) { return tally::runTally(argc, argv); }
