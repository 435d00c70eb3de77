// Entry routine of the operator's command program klpkccmd.
#pragma once

// Runs the program; answers the process exit code: 0 when the command
// succeeded, 12 otherwise, -1 when the message logger cannot be made.
int klpkccmdMain(int argc, char** argv);
