# Development stand-in for the decommission script, run by the development
# host through /bin/sh (the production script is PowerShell). The production
# script hands this server's role over and restarts the host, so the plug-in
# normally never sees it end while it is open; every end it does see is a
# failure.
#
# What this stand-in does:
#   1. appends a time-stamped line to logs/failover.log (relative to the
#      host's current directory);
#   2. if SORVIK_FAILOVER_EXIT is set, exits at once with that code, to try
#      the plug-in's failure report;
#   3. under the development host (SORVIK_HOST_PID set) and unless
#      SORVIK_FAILOVER_RESTART is 0, asks the host to restart the plug-in,
#      as the production script's service restart does, and ends a few
#      seconds later, after the restart has closed the plug-in;
#   4. otherwise stays running for SORVIK_FAILOVER_HOLD seconds (default 900,
#      longer than the plug-in's default 600-second limit), like a script that
#      is still at work when the host goes down. It gives up early when the
#      process that started it is gone, so no stray copy outlives the host.
# It takes no arguments, reads nothing from standard input and prints only a
# progress line on standard output.

mkdir -p logs 2>/dev/null
echo "$(date -u '+%Y-%m-%dT%H:%M:%SZ') decommission requested (pid $$)" >> logs/failover.log
echo "Decommissioning server"

if [ -n "${SORVIK_FAILOVER_EXIT:-}" ]; then
  echo "$(date -u '+%Y-%m-%dT%H:%M:%SZ') exiting with code ${SORVIK_FAILOVER_EXIT}" >> logs/failover.log
  exit "${SORVIK_FAILOVER_EXIT}"
fi

hold="${SORVIK_FAILOVER_HOLD:-900}"
if [ -n "${SORVIK_HOST_PID:-}" ] && [ "${SORVIK_FAILOVER_RESTART:-1}" != "0" ]; then
  echo "$(date -u '+%Y-%m-%dT%H:%M:%SZ') asking the host to restart" >> logs/failover.log
  kill -HUP "$SORVIK_HOST_PID"
  hold=5
fi
case "$hold" in
  ''|*[!0-9]*) hold=900 ;;
esac
starter=$PPID
elapsed=0
while [ "$elapsed" -lt "$hold" ] && kill -0 "$starter" 2>/dev/null; do
  sleep 1
  elapsed=$((elapsed + 1))
done
echo "$(date -u '+%Y-%m-%dT%H:%M:%SZ') stand-in finished after ${elapsed} s" >> logs/failover.log
exit 0
