#include "cli/GuardedMain.h"
#include "cli/HeapsnapDriver.h"

int main(int argc, char** argv) { return tally::guardedMain(tally::runHeapsnap, argc, argv); }
