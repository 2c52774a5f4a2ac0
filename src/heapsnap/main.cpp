#include "cli/HeapsnapDriver.h"

int main(int argc, char** argv) { return tally::runHeapsnap(argc, argv); }
