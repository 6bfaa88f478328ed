#!/usr/bin/env bash
# Installs the Debian packages the build, tests and demo need. Safe to run
# repeatedly: it does nothing when everything is present, and refreshes the
# package lists at most once per run.
set -euo pipefail

packages=(
  cmake ninja-build g++ clang make python3 curl
  libtinyxml-dev libboost-filesystem-dev libboost-dev libmbedtls-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  libclang-rt-14-dev
)
if [ "$#" -gt 0 ]; then packages+=("$@"); fi

missing=()
for p in "${packages[@]}"; do
  status=$(dpkg-query -W -f='${db:Status-Status}' "$p" 2>/dev/null || true)
  [ "$status" = "installed" ] || missing+=("$p")
done
[ "${#missing[@]}" -eq 0 ] && exit 0

sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"
echo "install-deps: installing ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
