// Entry routine of the operator's command program klpkccmd.
#pragma once

// Runs the program and ends the process through the main thread's end:
// exit code 0 when the command succeeded, 12 otherwise. Returns only when the
// message logger cannot be made, with -1.
int klpkccmdMain(int argc, char** argv);
