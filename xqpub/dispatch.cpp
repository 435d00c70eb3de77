#include "xqpub/dispatch.h"

int klpCmdDispatch(int) { return 0; }
