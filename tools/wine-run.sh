#!/usr/bin/env bash
# Runs a Windows program under Wine for the cross build's tests (ctest uses
# it as the emulator): wine-run.sh PROGRAM.exe [ARGS...]. `wine-run.sh --stop`
# ends the Wine server of the prefix used here.
#
# One prefix is kept in a cache directory and reused: creating one costs
# several seconds. Wine's helper processes (services, device manager) are
# started once with their output on /dev/null; started from a test they
# would inherit ctest's output pipe and hold every test open until they
# exit.
set -euo pipefail

cache=${SORVIK_WINDOWS_CACHE:-$HOME/.cache/sorvik-windows}
export WINEPREFIX=${SORVIK_WINE_PREFIX:-$cache/wine-prefix}
export WINEDEBUG=${WINEDEBUG:--all}
# No Mono or Gecko installer prompts; nothing here needs them.
export WINEDLLOVERRIDES=${WINEDLLOVERRIDES:-mscoree,mshtml=}
export WINEARCH=win64
# Every test shares the prefix's one process table, and closing the plug-in
# stops every process with the agent's image name. Tests get a name no real
# agent has; a test that runs kelp.exe itself clears it and runs alone.
export SORVIK_AGENT_IMAGE_NAME=${SORVIK_AGENT_IMAGE_NAME-sorvik-tests-no-agent.exe}
wine=${SORVIK_WINE:-/usr/lib/wine/wine64}
wineserver=${SORVIK_WINESERVER:-/usr/lib/wine/wineserver64}

if [ "${1:-}" = "--stop" ]; then
  [ -d "$WINEPREFIX" ] && "$wineserver" -k >/dev/null 2>&1 || true
  exit 0
fi

mkdir -p "$cache"
# The first caller boots the prefix; concurrent callers wait for it. The
# server lingers 60 s after its last client, so a test run pays the boot
# once.
(
  flock 9
  # The lock's descriptor is closed for Wine: a lingering server holding
  # it would block the next caller until the server exits.
  "$wineserver" -p60 </dev/null >/dev/null 2>&1 9>&- || true
  if [ ! -f "$WINEPREFIX/.sorvik-ready" ]; then
    "$wine" cmd /c exit </dev/null >/dev/null 2>&1 9>&-
    touch "$WINEPREFIX/.sorvik-ready"
  fi
  # Brings up the helper services of a cold server with their output
  # detached; cheap when the server is already up.
  "$wine" cmd /c exit </dev/null >/dev/null 2>&1 9>&-
) 9>"$cache/.wine-boot.lock"

exec "$wine" "$@"
