#!/usr/bin/env bash
# Runs every benchmark of a Release build and writes docs/benchmarks.md with
# the ratios that the project's speed targets are stated in.
#   tools/run-benchmarks.sh BUILD_DIR
set -euo pipefail
build=${1:?build directory}
root=$(cd "$(dirname "$0")/.." && pwd)
out=$(mktemp -d)
trap 'rm -rf "$out"' EXIT
for bench in "$build"/bench/*_bench; do
  [ -x "$bench" ] || continue
  name=$(basename "$bench")
  echo "== $name"
  "$bench" --benchmark_enable_random_interleaving=true --benchmark_format=console --benchmark_out="$out/$name.json" --benchmark_out_format=json
done
python3 "$root/tools/bench_report.py" "$out" > "$root/docs/benchmarks.md"
cat "$root/docs/benchmarks.md"
