#!/usr/bin/env bash
# Soak: one sample server under load for a while, with its trace on.
# Starts klpkcap under a private TMPDIR, turns its trace on, and runs 8
# command loops (STATUS, STATUS SHOW DETAILS, QRYPARMS and CHGPARMS
# COMMIT_INTERVAL, in turn) and one trace loop (klptrc dmp to a file, fmt of
# that file, fmt of the live buffer) until the time is up. Then it turns the
# trace off, STOPs the server and prints commands per second, the slowest
# command, the server's resident memory at start and end (and its lowest and
# highest in between), and every queue or shared-memory object of the run
# that is left. Exits 1 when a command failed, the server did not stop, or
# an object is left. Not part of `make test`.
#
#   scripts/soak.sh BUILD_DIR [SECONDS]      (SECONDS defaults to 600)
set -euo pipefail

BUILD_DIR=${1:-build}
SECONDS_TO_RUN=${2:-600}
BIN="$BUILD_DIR/bin"
. "$(dirname "$0")/klpserver.sh"
klp_need "$BIN" klpkcap klpkccmd klptrc klptrcbp

SERVER=SOAK
klp_private_ipc klpsoak
SERVER_PID=""

cleanup() {
  trap - EXIT INT TERM
  "$BIN/klptrc" kill -db "$SERVER" -kcap >/dev/null 2>&1 || true
  klp_end_process "$SERVER_PID"
  rm -rf "$DIR"
}
trap cleanup EXIT
trap 'echo "soak: interrupted"; exit 130' INT TERM

klp_start_server "$BIN" "$SERVER"

set +e
python3 - "$BIN" "$SERVER" "$DIR/" "$SERVER_PID" "$SECONDS_TO_RUN" <<'EOF'
import os, subprocess, sys, threading, time

bin_dir, server, ipc_dir, server_pid, seconds = sys.argv[1:6]
server_pid, seconds = int(server_pid), float(seconds)
prefix = f"{ipc_dir}{server}.KLP.KCAP"
kccmd = [f"{bin_dir}/klpkccmd", f"CAPTURE_SERVER={server}"]
trc = [f"{bin_dir}/klptrc"]
where = ["-db", server, "-kcap"]

def posix_name(kind, path):
    # docs/ipc-names.md: FNV-1a over the path's bytes.
    h = 0xcbf29ce484222325
    for b in path.encode():
        h = ((h ^ b) * 0x100000001b3) & 0xFFFFFFFFFFFFFFFF
    return f"klp{kind}.{h:016x}"

def rss_kb():
    # Resident memory, and the part of it that is the process's own heap and
    # stacks (the rest is code and the shared trace block).
    got = {}
    with open(f"/proc/{server_pid}/status") as f:
        for line in f:
            key, _, value = line.partition(":")
            if key in ("VmRSS", "RssAnon"):
                got[key] = int(value.split()[0])
    return got.get("VmRSS", -1), got.get("RssAnon", -1)

def alive():
    try:
        with open(f"/proc/{server_pid}/stat") as f:
            return f.read().split()[2] != "Z"  # a zombie waits for the shell
    except OSError:
        return False

lock = threading.Lock()
counts, failures, pids = {}, [], []
failed = 0
slowest = (0.0, "")

def run(argv, label, counted=True):
    global slowest, failed
    begin = time.perf_counter()
    p = subprocess.Popen(argv, stdout=subprocess.PIPE, stderr=subprocess.STDOUT)
    out, _ = p.communicate()
    took = time.perf_counter() - begin
    with lock:
        pids.append(p.pid)
        if counted:
            counts[label] = counts.get(label, 0) + 1
        if counted and took > slowest[0]:
            slowest = (took, label)
        failed += p.returncode != 0
        if p.returncode != 0 and len(failures) < 20:
            failures.append(f"{label}: exit {p.returncode}: {out.decode(errors='replace')[-400:]}")
    return p.returncode

# The steps before and after the load are neither counted nor timed.
def step(argv, label):
    if run(argv, label, False) != 0:
        raise SystemExit(f"soak: {label} failed")

step(trc + ["on"] + where, "klptrc on")
rss_start = rss_kb()
rss_low = rss_high = rss_start[0]
rss_warm = None
deadline = time.monotonic() + seconds

def client(n):
    mix = [(["STATUS"], "STATUS"),
           (["STATUS", "SHOW", "DETAILS"], "STATUS SHOW DETAILS"),
           (["QRYPARMS"], "QRYPARMS"),
           (["CHGPARMS", f"COMMIT_INTERVAL={1000 + n}"], "CHGPARMS COMMIT_INTERVAL")]
    i = n
    while time.monotonic() < deadline:
        args, label = mix[i % len(mix)]
        run(kccmd + args, label)
        i += 1

def tracer():
    dump = f"{ipc_dir}soak.dmp"
    while time.monotonic() < deadline:
        run(trc + ["dmp", dump] + where, "klptrc dmp")
        run(trc + ["fmt", "-fn", dump], "klptrc fmt of the dump")
        run(trc + ["fmt"] + where, "klptrc fmt of the buffer")
        try:
            os.unlink(dump)
        except FileNotFoundError:
            pass

began = time.monotonic()
workers = [threading.Thread(target=client, args=(n,)) for n in range(8)]
workers.append(threading.Thread(target=tracer))
for w in workers:
    w.start()
while any(w.is_alive() for w in workers):
    time.sleep(1)
    rss = rss_kb()
    rss_low, rss_high = min(rss_low, rss[0]), max(rss_high, rss[0])
    if rss_warm is None and time.monotonic() - began >= min(60, seconds / 2):
        rss_warm = rss
elapsed = time.monotonic() - began
rss_end = rss_kb()

step(trc + ["off"] + where, "klptrc off")
stopped = run(kccmd + ["STOP"], "STOP", False) == 0
for _ in range(300):
    if not alive():
        break
    time.sleep(0.1)
stopped = stopped and not alive()
time.sleep(0.5)  # the trace keeper lets go within its poll

names = {posix_name("q", f"{prefix}.IPC"): "server queue",
         posix_name("m", f"{prefix}.TRC"): "trace block"}
for pid in pids:
    names[posix_name("q", f"{prefix}.IPC.CMD{pid}")] = f"reply queue of {pid}"
left = [f"{names[e]} /{e}" for d in ("/dev/mqueue", "/dev/shm") if os.path.isdir(d)
        for e in os.listdir(d) if e in names]

kccmd_total = sum(v for k, v in counts.items() if not k.startswith("klptrc"))
total = sum(counts.values())
print(f"duration            : {elapsed:.0f} s, 8 command loops and 1 trace loop")
for label in sorted(counts):
    print(f"  {label:26s}: {counts[label]}")
print(f"commands per second : {total / elapsed:.1f} in all, {kccmd_total / elapsed:.1f} of them klpkccmd")
print(f"slowest command     : {slowest[1]}, {slowest[0] * 1000:.0f} ms")
rss_warm = rss_warm or rss_end
print(f"server RSS          : {rss_start[0]} kB at start, {rss_warm[0]} kB after warm-up, "
      f"{rss_end[0]} kB at end (lowest {rss_low}, highest {rss_high})")
print(f"  of it anonymous   : {rss_start[1]} kB at start, {rss_warm[1]} kB after warm-up, "
      f"{rss_end[1]} kB at end")
print(f"server stopped      : {'yes' if stopped else 'NO'}")
print(f"IPC objects left    : {', '.join(left) if left else 'none'}")
print(f"failed commands     : {failed}")
for f in failures:
    print("  " + f)
sys.exit(0 if stopped and not left and not failed else 1)
EOF
rc=$?
set -e
wait "$SERVER_PID" 2>/dev/null || true
SERVER_PID=""
exit $rc
