#!/usr/bin/env bash
# Installs what the Windows cross build and its Wine test run need: the
# MinGW-w64 compilers (POSIX thread model, for std::thread and std::mutex),
# Wine, and a deb-src entry so that fetch-windows-sources.sh can take the
# third-party libraries from Debian's own source packages. Idempotent.
set -euo pipefail

packages=(g++-mingw-w64-x86-64-posix gcc-mingw-w64-x86-64-posix binutils-mingw-w64-x86-64
          wine64 dpkg-dev cmake ninja-build make xz-utils)

sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"
export DEBIAN_FRONTEND=noninteractive

# Source entries mirror the binary ones, so the sources match the suite.
src_list=/etc/apt/sources.list.d/sorvik-deb-src.sources
updated=0
if [ ! -f "$src_list" ]; then
  main_list=/etc/apt/sources.list.d/debian.sources
  if [ -f "$main_list" ]; then
    sed -e 's/^Types: deb$/Types: deb-src/' "$main_list" | $sudo tee "$src_list" >/dev/null
  else
    printf 'Types: deb-src\nURIs: http://deb.debian.org/debian\nSuites: bookworm bookworm-updates\nComponents: main\nSigned-By: /usr/share/keyrings/debian-archive-keyring.gpg\n' |
      $sudo tee "$src_list" >/dev/null
  fi
  $sudo apt-get update -qq
  updated=1
fi

missing=()
for p in "${packages[@]}"; do
  status=$(dpkg-query -W -f='${db:Status-Status}' "$p" 2>/dev/null || true)
  [ "$status" = "installed" ] || missing+=("$p")
done
if [ "${#missing[@]}" -gt 0 ]; then
  echo "install-windows-deps: installing ${missing[*]}"
  [ "$updated" -eq 1 ] || $sudo apt-get update -qq
  $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi
