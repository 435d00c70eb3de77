// Command dispatch of klpkccmd: send the command found on the command line,
// or fetch and print the detailed status report.
#pragma once

// Runs after the command line was parsed and the schema handed to the logger.
// detailsFlag: the command line held STATUS SHOW DETAILS. Answers the rc.
int klpCmdDispatch(int detailsFlag);
