#!/usr/bin/env bash
# Command round-trip time: runs `klpkccmd CAPTURE_SERVER=BENCH STATUS` against
# an idle sample server N times, `klpkccmd ?` (the program's start alone) N
# times and /bin/true N times in the same run (interleaved, so all see the
# same machine load), and prints the median whole-process time of each and
# their ratios to /bin/true. The target for STATUS is a ratio within 1.5.
# Wall-clock ratios on a loaded machine are noisy: compare builds by running
# the script for each side by side several times.
#
#   scripts/bench_command.sh BUILD_DIR [N]      (N defaults to 200)
set -euo pipefail

BUILD_DIR=${1:-build}
RUNS=${2:-200}
BIN="$BUILD_DIR/bin"
. "$(dirname "$0")/klpserver.sh"
klp_need "$BIN" klpkcap klpkccmd

SERVER=BENCH
klp_private_ipc klpbench
SERVER_PID=""

cleanup() {
  trap - EXIT INT TERM
  klp_end_process "$SERVER_PID"
  rm -rf "$DIR"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

klp_start_server "$BIN" "$SERVER"

python3 - "$BIN/klpkccmd" "$SERVER" "$RUNS" <<'EOF'
import os, statistics, subprocess, sys, time

cmd = [sys.argv[1], "CAPTURE_SERVER=" + sys.argv[2], "STATUS"]
start = [sys.argv[1], "?"]
true = ["/bin/true"]
runs = int(sys.argv[3])

def once(argv):
    begin = time.perf_counter()
    rc = subprocess.call(argv, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    return time.perf_counter() - begin, rc

# One of each first, unmeasured, so that all come from the page cache.
once(cmd)
once(start)
once(true)
t_cmd, t_start, t_true, failed = [], [], [], 0
for _ in range(runs):
    t, rc = once(cmd)
    t_cmd.append(t)
    failed += rc != 0
    t_start.append(once(start)[0])
    t_true.append(once(true)[0])

m_cmd = statistics.median(t_cmd) * 1000
m_start = statistics.median(t_start) * 1000
m_true = statistics.median(t_true) * 1000
print(f"klpkccmd STATUS : median {m_cmd:8.3f} ms over {runs} runs")
print(f"klpkccmd ?      : median {m_start:8.3f} ms over {runs} runs")
print(f"/bin/true       : median {m_true:8.3f} ms over {runs} runs")
print(f"ratio ?         : {m_start / m_true:8.2f}")
print(f"ratio STATUS    : {m_cmd / m_true:8.2f} (target: within 1.5)")
if failed:
    print(f"klpkccmd failed {failed} of {runs} times: the times above do not measure a command",
          file=sys.stderr)
    sys.exit(1)
EOF
