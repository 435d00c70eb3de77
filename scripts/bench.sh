#!/usr/bin/env bash
# Runs every benchmark of a build made with KLP_BENCH=ON, then the command
# round-trip benchmark against the sample server.
set -euo pipefail
build=${1:-build-bench}
here=$(cd "$(dirname "$0")" && pwd)
for b in "$build"/bin/*_bench; do
  [ -x "$b" ] || continue
  echo "== $(basename "$b")"
  "$b" --benchmark_min_time=0.2
done
echo "== klpkccmd STATUS round trip"
"$here/bench_command.sh" "$build"
