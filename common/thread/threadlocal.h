// The calling thread's klpThread as a thread-local pointer: set by the
// prologue, cleared when the thread ends. Only for places that cannot take
// the thread-id list's lock, such as the signal handler.
#pragma once

class klpThread;

klpThread* klpTlsCurrentThread();
void klpTlsSetCurrentThread(klpThread* thread);
