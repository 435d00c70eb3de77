#!/usr/bin/env bash
# Demonstration: starts the sample K Capture server under a private TMPDIR,
# commands it with klpkccmd (STATUS, STATUS SHOW DETAILS, QRYPARMS, CHGPARMS,
# QRYPARMS again), turns its trace on with klptrc, formats a short trace and
# turns it off, then STOPs it, waits for it to end and shows the end of its
# log.
# Leaves no process, queue or file behind, also when interrupted.
#
#   scripts/demo.sh BUILD_DIR      (e.g. scripts/demo.sh build)
set -euo pipefail

BUILD_DIR=${1:-build}
BIN="$BUILD_DIR/bin"
. "$(dirname "$0")/klpserver.sh"
klp_need "$BIN" klpkcap klpkccmd klptrc klptrcbp

SERVER=DEMO
klp_private_ipc klpdemo
LOG="$DIR/$SERVER.KLP.KCAP.log"
SERVER_QUEUE="$DIR/$SERVER.KLP.KCAP.IPC"
SERVER_PID=""
CLIENT_PID=""
TRACE_ON=""

# Removes the POSIX message queue of a path (named as docs/ipc-names.md says),
# for the case where a process had to be killed before it could do so.
unlink_queue() {
  python3 - "$1" <<'EOF' 2>/dev/null || true
import ctypes, ctypes.util, sys
h = 0xcbf29ce484222325
for b in sys.argv[1].encode():
    h = ((h ^ b) * 0x100000001b3) & 0xFFFFFFFFFFFFFFFF
rt = ctypes.CDLL(ctypes.util.find_library("rt") or "librt.so.1")
rt.mq_unlink(("/klpq.%016x" % h).encode())
EOF
}

cleanup() {
  trap - EXIT INT TERM
  [[ -n "$TRACE_ON" ]] && "$BIN/klptrc" kill -db "$SERVER" -kcap >/dev/null 2>&1
  klp_end_process "$CLIENT_PID"
  [[ -n "$CLIENT_PID" ]] && unlink_queue "$SERVER_QUEUE.CMD$CLIENT_PID"
  klp_end_process "$SERVER_PID"
  unlink_queue "$SERVER_QUEUE"
  rm -rf "$DIR"
}
trap cleanup EXIT
trap 'echo; echo "demo: interrupted"; exit 130' INT TERM

echo "IPC directory: $TMPDIR"
echo "\$ klpkcap CAPTURE_SERVER=$SERVER CAPTURE_PATH=$DIR/ &"
klp_start_server "$BIN" "$SERVER"

failures=0
command() {
  echo
  echo "\$ klpkccmd CAPTURE_SERVER=$SERVER $*"
  "$BIN/klpkccmd" "CAPTURE_SERVER=$SERVER" "$@" &
  CLIENT_PID=$!
  local rc=0
  wait "$CLIENT_PID" || rc=$?
  CLIENT_PID=""
  echo "(exit code $rc)"
  [[ $rc -eq 0 ]] || failures=$((failures + 1))
}

command STATUS
command STATUS SHOW DETAILS
command QRYPARMS
command CHGPARMS COMMIT_INTERVAL=1000
command QRYPARMS
# The trace: on for the running server (which attaches at once), a command
# to have something to trace, the flow and the full format, and off.
trace() {
  echo
  echo "\$ klptrc $*"
  "$BIN/klptrc" "$@"
}
# A formatting style, less the version and thread-data header it starts with.
records() {
  echo
  echo "\$ klptrc $*    (the records, without the header)"
  "$BIN/klptrc" "$@" | sed '1,/Thread Specific Data End/d' | head -n 40
}
echo
echo "--- a short trace"
TRACE_ON=1
trace on -db "$SERVER" -kcap
command STATUS
records flw -db "$SERVER" -kcap
records fmt -db "$SERVER" -kcap
trace off -db "$SERVER" -kcap
TRACE_ON=""

command STOP

echo
rc=0
for i in $(seq 1 300); do
  kill -0 "$SERVER_PID" 2>/dev/null || break
  sleep 0.1
done
if kill -0 "$SERVER_PID" 2>/dev/null; then
  echo "klpkcap did not stop; ending it"
  klp_end_process "$SERVER_PID"
  failures=$((failures + 1))
else
  wait "$SERVER_PID" || rc=$?
  echo "klpkcap ended with exit code $rc"
fi
SERVER_PID=""

echo
echo "--- the last lines of $LOG"
tail -n 12 "$LOG"
exit $((failures > 0 ? 1 : 0))
