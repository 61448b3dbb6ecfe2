#!/usr/bin/env bash
# Runs every *_fuzz binary in the given directory for the given seconds each, keeping a
# corpus per target next to that directory; fails if any target finds a crash.
# Usage: run-fuzzers.sh [binary-dir] [seconds-per-target]
set -euo pipefail
dir=${1:-build/fuzz/fuzz}
seconds=${2:-60}
root=$(dirname "$dir")
status=0
found=0
for bin in "$dir"/*_fuzz; do
  [ -f "$bin" ] && [ -x "$bin" ] || continue
  found=1
  name=$(basename "$bin")
  corpus="$root/corpus/$name"
  artifacts="$root/artifacts/$name"
  mkdir -p "$corpus" "$artifacts"
  echo "== $name (${seconds}s)"
  if ! "$bin" -max_total_time="$seconds" -print_final_stats=1 \
       -artifact_prefix="$artifacts/" "$corpus"; then
    echo "!! $name failed; reproducer in $artifacts/" >&2
    status=1
  fi
done
if [ "$found" = 0 ]; then
  echo "no *_fuzz binaries in $dir" >&2
  exit 1
fi
exit $status
