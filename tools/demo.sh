#!/usr/bin/env bash
# make demo: loads the built plug-in the way the host does and checks that it
# announces itself.
set -euo pipefail
build=${1:-build}
root=$(cd "$(dirname "$0")/.." && pwd)
version=$(sed -n 's/^SORVIK_VERSION:STRING=//p' "$build/CMakeCache.txt")
exec "$build/host/sorvik-load" "$build/Sorvik/libsorvik.so" "$version"
