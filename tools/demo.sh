#!/usr/bin/env bash
# make demo: Sorvik's jobs end to end on this machine, driven by the
# development host with real child processes.
#   1. self-update: version N downloads version N+1 from a local HTTP server,
#      checks its MD5, installs it with scripts/update.ps1, restarts and
#      reports UPDATE_SUCCESS;
#   2. failover and failback: role changes, a refused change, the failback
#      agent reached on its port and stopped, and a spare reset.
# Exits non-zero when any step is missing.
set -euo pipefail

build=${1:-build}
root=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "$build" && pwd)
version=$(sed -n 's/^SORVIK_VERSION:STRING=//p' "$build/CMakeCache.txt")
next=$(sed -n 's/^SORVIK_NEXT_VERSION:INTERNAL=//p' "$build/CMakeCache.txt")

demo=$root/demo-run
rm -rf "$demo"
mkdir -p "$demo/work/scripts" "$demo/served" "$demo/drives/spare-d1"
work=$demo/work
log=$demo/host.log

cp "$build/Sorvik/libsorvik.so" "$work/libsorvik.so"
ln -s "$(command -v curl)" "$work/curl"
ln -s "$build/bin/kelp" "$work/kelp"
cp "$root/scripts/update.ps1" "$root/scripts/failover.ps1" "$work/scripts/"
tar czf "$demo/served/sorvik-$next.tar.gz" -C "$build/next" libsorvik.so
md5=$(md5sum "$demo/served/sorvik-$next.tar.gz" | cut -d' ' -f1)

pids=()
cleanup() {
  exec 3>&- 2>/dev/null || true
  for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null || true; done
}
trap cleanup EXIT

python3 "$root/tools/serve-dir.py" "$demo/served" "$demo/port" &
pids+=($!)
for _ in $(seq 100); do [ -s "$demo/port" ] && break; sleep 0.05; done
[ -s "$demo/port" ] || { echo "demo: HTTP server did not start" >&2; exit 1; }
url="http://127.0.0.1:$(cat "$demo/port")/sorvik-$next.tar.gz"

# The host reads instructions from a pipe so that this script can act on
# what it reports (the agent's port) between instructions.
mkfifo "$demo/host-in"
"$build/bin/sorvik-host" -C "$work" -l PROGRESS -w 60 "$work/libsorvik.so" <"$demo/host-in" >"$log" 2>&1 &
host_pid=$!
pids+=($host_pid)
exec 3>"$demo/host-in"
tail -n +1 -f "$log" --pid=$host_pid &
pids+=($!)

say() { printf '%s\n' "$1" >&3; }
# Waits (with a deadline) until the host's output matches an extended regex.
await() {
  local pattern=$1 deadline=$((SECONDS + ${2:-60}))
  until grep -Eq "$pattern" "$log"; do
    kill -0 "$host_pid" 2>/dev/null || { echo "demo: host ended early" >&2; return 1; }
    [ "$SECONDS" -lt "$deadline" ] || { echo "demo: timed out waiting for /$pattern/" >&2; return 1; }
    sleep 0.1
  done
}

say "echo ===== Self-update from $version to $next"
say "wait Version=\"$version\""
say "wait SpareResetStatus"
say "update $url $md5"
say "wait -t 60 Version=\"$next\""
say "wait -t 30 Status=\"13\""

say "echo ===== Failover roles"
say "failover COMMISSIONED"
say "wait FailoverStatus=\"-102\""
say "echo demo: PROTECTED to COMMISSIONED was refused, as the state machine requires"
say "failover DECOMMISSION_FAILOVER"
say "wait FailoverStatus=\"101\""
say "wait -t 30 plug-in restarted"
say "wait FailoverState=\"102\""
say "wait SpareResetStatus"
say "failover COMMISSIONED"
say "wait FailoverStatus=\"104\""
say "failover RESERVE_SPARE"
say "wait FailoverStatus=\"101\""
say "wait -t 30 plug-in restarted"
say "wait FailoverState=\"105\""
# Commands wait until the restarted worker has reported its state.
say "wait SpareResetStatus"

echo "disk image" >"$demo/drives/spare-d1/recording.bin"
touch "$demo/drives/spare-d1/.kelp-spare"
say "echo ===== Failback agent"
say "drives $demo/drives/spare-d1"
say "agent-start now-86400 now+60 demo-token 7066"
say "wait -t 30 FailbackStatus=\"202\""
await 'FailbackStatus="202" Port="[0-9]+"' 120
port=$(grep -Eo 'FailbackStatus="202" Port="[0-9]+"' "$log" | tail -1 | grep -Eo '[0-9]+"$' | tr -d '"')
if curl -fsS --max-time 5 -H "Authorization: Bearer demo-token" "http://127.0.0.1:$port/files" >"$demo/agent-reply"; then
  say "echo demo: the failback agent answered on port $port: $(tr '\t\n' '  ' <"$demo/agent-reply")"
else
  say "echo demo: the failback agent did not answer on port $port"
fi
say "agent-stop"
say "wait -t 30 FailbackStatus=\"200\""

say "echo ===== Spare reset"
say "agent-reset now-60 now"
say "wait -t 30 SpareResetStatus=\"205\""
say "quit"
exec 3>&-
status=0
wait "$host_pid" || status=$?
sleep 0.2

check() {
  if grep -Eq "$2" "$log"; then echo "  [ok]      $1"; else echo "  [MISSING] $1"; status=1; fi
}
echo
echo "===== Summary"
check "version $version announced" "Module Name=\"Sorvik\" ID=\"3670016\" Version=\"$version\""
check "download progress reported" 'Status="1" Progress="[1-9]'
check "checksum passed" "Received checksum \\($md5\\)"
check "installation script started (PENDING_UPDATE)" 'Status="3"'
check "host restarted by the script" "restart"
check "version $next announced after the restart" "Version=\"$next\""
check "UPDATE_SUCCESS reported" 'Status="13"'
[ -s "$work/logs/update.log" ] && echo "  [ok]      logs/update.log written" || { echo "  [MISSING] logs/update.log"; status=1; }
check "refused transition (NOT_PERMITTED)" 'FailoverStatus="-102"'
check "decommission script run (DECOMMISSION_PENDING)" 'FailoverStatus="101"'
check "role DECOMMISSION_FAILOVER after the restart" 'FailoverState="102"'
check "role COMMISSIONED" 'FailoverStatus="104"'
check "role RESERVE_SPARE after the restart" 'FailoverState="105"'
check "failback agent READY on its port" 'FailbackStatus="202" Port="[0-9]+"'
check "failback agent reached on its port" "the failback agent answered on port"
check "failback agent stopped (NONE)" 'FailbackStatus="200"'
check "spare reset COMPLETED" 'SpareResetStatus="205"'
if [ -e "$demo/drives/spare-d1/recording.bin" ]; then echo "  [MISSING] spare drive emptied"; status=1; else echo "  [ok]      spare drive emptied"; fi
if [ "$status" -eq 0 ]; then echo "demo: all steps done"; else echo "demo: some steps are missing (see $log)"; fi
exit "$status"
