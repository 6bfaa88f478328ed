#!/usr/bin/env bash
# Fetches Debian's own source packages of the libraries the Windows build
# compiles itself (TinyXML, mbed TLS, Boost headers and Boost.Filesystem)
# into a cache outside the repository and prints nothing when they are
# already there. Usage: fetch-windows-sources.sh [CACHE_DIR]
set -euo pipefail

cache=${1:-${SORVIK_WINDOWS_CACHE:-$HOME/.cache/sorvik-windows}}
src="$cache/src"
mkdir -p "$src"

sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"

# Runs apt-get source in a scratch directory and leaves the files there;
# refreshes the package lists once when the source package is unknown.
download() {
  local work=$1 name=$2
  rm -rf "$work" && mkdir -p "$work"
  # apt drops privileges to _apt for downloads; let it write here.
  chmod 777 "$work"
  local attempt
  for attempt in 1 2; do
    if (cd "$work" && apt-get source --download-only -qq "$name" 2>&1 |
          grep -v '^W: Download is performed unsandboxed'; exit "${PIPESTATUS[0]}"); then
      return 0
    fi
    [ "$attempt" -eq 1 ] && $sudo apt-get update -qq
  done
  echo "fetch-windows-sources: cannot fetch the source package $name" >&2
  exit 1
}

unpack_dsc() {
  local name=$1
  [ -f "$src/$name/.done" ] && return 0
  echo "fetch-windows-sources: $name"
  local work="$src/.$name-download"
  download "$work" "$name"
  local dsc
  dsc=$(ls "$work"/"$name"_*.dsc)
  rm -rf "$src/$name"
  # Debian's patches are applied as part of unpacking.
  dpkg-source --no-check -x "$dsc" "$src/$name" >/dev/null
  rm -f "$src/$name"_*.orig.tar.*
  touch "$src/$name/.done"
  rm -rf "$work"
}

unpack_boost() {
  [ -f "$src/boost/.done" ] && return 0
  echo "fetch-windows-sources: boost1.74 (headers and Boost.Filesystem only)"
  local work="$src/.boost-download"
  download "$work" boost1.74
  rm -rf "$src/boost" && mkdir -p "$src/boost"
  # Only the header trees and the filesystem sources are needed; each
  # library's include/ directory is merged into one include/.
  tar -xJf "$work"/boost1.74_*.orig.tar.xz -C "$src/boost" \
    --wildcards --no-wildcards-match-slash \
    'boost/libs/*/include' 'boost/libs/numeric/*/include' 'boost/libs/filesystem/src' \
    --transform 's|^boost/libs/\(numeric/\)\{0,1\}[^/]*/include/|include/|' \
    --transform 's|^boost/libs/filesystem/src/|filesystem-src/|'
  rm -rf "$src/boost/boost"
  touch "$src/boost/.done"
  rm -rf "$work"
}

if ! grep -rqs '^Types:.*deb-src' /etc/apt/sources.list.d/ && ! grep -qs '^deb-src' /etc/apt/sources.list; then
  echo "fetch-windows-sources: no deb-src entry; run tools/install-windows-deps.sh first" >&2
  exit 1
fi

unpack_dsc tinyxml
unpack_dsc mbedtls
unpack_boost
