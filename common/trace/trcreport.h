// The trace command's reports: status (stat, statg, statlong) from the
// buffer or a file, the filter settings (diag), the symbol list and the
// usage text.
#pragma once

#include "common/trace/trcopts.h"

void trcStatusReport(const trcOptions* o);
void trcDiagReport();
void trcListSymbols();
void trcUsage();
