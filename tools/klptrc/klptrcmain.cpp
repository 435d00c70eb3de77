// klptrc: the trace utility. Everything is done by the library's exported
// entry point; see `klptrc -help`.
#include "include/klptrc.h"

int main(int argc, char** argv) { return _klpTrace(argc, argv); }
