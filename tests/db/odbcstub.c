/* A stand-in driver library for the loader tests: its functions carry the
 * suffix "A", and SQLCancel and SQLDisconnect are missing. */
int SQLAllocHandleA(int type) { return type + 1; }
int SQLConnectA(void) { return 7; }
