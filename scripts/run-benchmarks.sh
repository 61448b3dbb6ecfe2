#!/usr/bin/env bash
# Runs every benchmark binary in the given directory; each prints its ratios at the end.
set -euo pipefail
dir=${1:-build/bench/bench}
status=0
for bin in "$dir"/*_bench; do
  [ -x "$bin" ] || continue
  echo "== $(basename "$bin")"
  "$bin" --benchmark_min_time=0.2 || status=1
done
exit $status
