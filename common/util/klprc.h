// Result codes shared across the run-time: 32-bit signed, 0 for success.
#pragma once

enum klpRC : int {
  KLP_OK = 0,
  KLP_RC_NO_MEMORY = 801,          // no memory for a run-time object
  KLP_RC_THREAD = 802,             // OS thread not created or terminated
  KLP_RC_DUMP_FILE = 803,          // dump file not opened
  KLP_RC_QUEUE_UNAVAILABLE = 804,  // queue not available
  KLP_RC_PUT_FAILED = 805,
  KLP_RC_ATTACH_FAILED = 815,      // attach failed after 5 attempts
  KLP_RC_GET_FAILED = 816,
  KLP_RC_NO_REPLY = 824,           // no reply in time
  KLP_RC_BAD_VERSION = 825,        // reply of a wrong format version
  KLP_RC_MSG_NO_MEMORY = 1003,     // no memory for a message
  KLP_RC_NOT_LOCK_OWNER = 1005,    // lock released by a thread that does not hold it
  KLP_RC_BAD_PARM = 2002,          // bad parameter or argument
  KLP_RC_NO_SERVER = 2003,         // no server name or prefix
  KLP_RC_RECOVERED = 2009,         // returned to a recovery point
  KLP_RC_RECOVERY_LIMIT = 2010,    // recovery point returned to too often
  KLP_RC_THREAD_ENDED = 2011,      // thread ended with 0
  KLP_RC_TOO_LONG = 6005,          // string does not fit its buffer
};
