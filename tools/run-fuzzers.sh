#!/usr/bin/env bash
# Runs every fuzz target of a build for the given number of seconds each,
# starting from the seed corpus in fuzz/corpus/<name>/ and keeping what it
# finds in a scratch corpus outside the repository.
#   tools/run-fuzzers.sh BUILD_DIR SECONDS
set -euo pipefail
build=${1:?build directory}
seconds=${2:-60}
root=$(cd "$(dirname "$0")/.." && pwd)
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
found=0
for target in "$build"/fuzz/*_fuzz; do
  [ -x "$target" ] || continue
  found=1
  name=$(basename "$target" _fuzz)
  mkdir -p "$scratch/$name"
  echo "== fuzzing $name for ${seconds}s"
  "$target" -max_total_time="$seconds" -print_final_stats=1 "$scratch/$name" "$root/fuzz/corpus/$name"
done
[ "$found" -eq 1 ] || { echo "no fuzz targets in $build/fuzz" >&2; exit 1; }
