# Development stand-in for the installation script, run by the development
# host through /bin/sh (the production script is PowerShell).
#
#   update.ps1 BUNDLE
#
# BUNDLE is a tar.gz holding libsorvik.so. The script runs in the host's
# working directory and:
#   1. starts logs/update.log afresh (the plug-in reads it at its next start
#      and takes any "Update failed" line as a failed update);
#   2. unpacks libsorvik.so into a private directory and copies it next to the
#      installed library under a new name, then renames it over the old one:
#      the host keeps the old file mapped, so it is never written in place;
#   3. once update.xml carries the plug-in's pending mark, asks the host to
#      restart the plug-in with SIGHUP to SORVIK_HOST_PID;
#   4. stays until the restarted plug-in has rewritten update.xml without the
#      mark, so the old instance never sees this script end (any end it sees
#      counts as a failure).
#
# Exit codes, as the plug-in reports them negated:
#   0  installed and the plug-in restarted (not seen by the plug-in)
#   20 INSTALL_ERROR: bad arguments, no host to restart, file errors
#   21 INSTALL_TIMEOUT: the plug-in did not come back in time
#   23 INSTALL_VERIFY_FAILED: the bundle does not unpack to a library
#
# Environment: SORVIK_HOST_PID (set by the development host);
# SORVIK_UPDATE_TARGET, the library to replace (default ./libsorvik.so);
# SORVIK_UPDATE_RESTART_WAIT, seconds to wait for the restart (default 60).

log=logs/update.log
target="${SORVIK_UPDATE_TARGET:-./libsorvik.so}"
restart_wait="${SORVIK_UPDATE_RESTART_WAIT:-60}"
case "$restart_wait" in
  ''|*[!0-9]*) restart_wait=60 ;;
esac

mkdir -p logs 2>/dev/null
: > "$log"

say() {
  echo "$(date -u '+%Y-%m-%dT%H:%M:%SZ') $*" >> "$log"
}

fail() {
  code=$1
  shift
  say "Update failed: $*"
  exit "$code"
}

if [ "$#" -ne 1 ] || [ -z "$1" ]; then
  fail 20 "expected the bundle path as the only argument"
fi
bundle=$1
say "installing bundle $bundle (pid $$)"

[ -f "$bundle" ] || fail 20 "bundle not found: $bundle"
case "${SORVIK_HOST_PID:-}" in
  ''|*[!0-9]*) fail 20 "SORVIK_HOST_PID is not set; no host to restart" ;;
esac
kill -0 "$SORVIK_HOST_PID" 2>/dev/null || fail 20 "host process $SORVIK_HOST_PID is gone"

work=$(mktemp -d "${TMPDIR:-/tmp}/sorvik-update.XXXXXX") || fail 20 "cannot create a scratch directory"
trap 'rm -rf "$work"' EXIT

# Only the one member is taken: nothing else in the archive is written anywhere.
if ! tar -xzf "$bundle" -C "$work" libsorvik.so 2>/dev/null &&
   ! tar -xzf "$bundle" -C "$work" ./libsorvik.so 2>/dev/null; then
  fail 23 "bundle is not a tar.gz holding libsorvik.so"
fi
if [ ! -f "$work/libsorvik.so" ] || [ -h "$work/libsorvik.so" ] || [ ! -s "$work/libsorvik.so" ]; then
  fail 23 "libsorvik.so in the bundle is not a regular, non-empty file"
fi

staged="$target.new.$$"
if ! cp "$work/libsorvik.so" "$staged" 2>>"$log" || ! chmod 755 "$staged"; then
  rm -f "$staged"
  fail 20 "cannot write $staged"
fi
if ! mv -f "$staged" "$target" 2>>"$log"; then
  rm -f "$staged"
  fail 20 "cannot rename $staged over $target"
fi
say "installed $target"

# The plug-in marks the update as pending in update.xml right after starting
# this script; restarting it before that would lose the mark.
pending() {
  grep -q 'PendingUpdate="1"' update.xml 2>/dev/null
}
elapsed=0
until pending; do
  [ "$elapsed" -lt "$restart_wait" ] || fail 20 "update.xml never showed the pending update"
  sleep 1
  elapsed=$((elapsed + 1))
done

kill -HUP "$SORVIK_HOST_PID" 2>/dev/null || fail 20 "cannot signal host process $SORVIK_HOST_PID"
say "asked host $SORVIK_HOST_PID to restart the plug-in"

elapsed=0
while pending; do
  [ "$elapsed" -lt "$restart_wait" ] || fail 21 "plug-in did not restart within $restart_wait s"
  sleep 1
  elapsed=$((elapsed + 1))
done
say "plug-in restarted with the new library"
exit 0
