# Sample decommission script for the Windows package, for sorvik-host.exe.
# The production script hands this server's role over and restarts the
# host, so the plug-in normally never sees it end while it is open; every
# end it does see is a failure.
#
# What this sample does:
#   1. appends a time-stamped line to logs\failover.log (relative to the
#      host's current directory);
#   2. if SORVIK_FAILOVER_EXIT is set, exits at once with that code, to try
#      the plug-in's failure report;
#   3. under sorvik-host.exe (SORVIK_HOST_PID set) and unless
#      SORVIK_FAILOVER_RESTART is 0, asks the host to restart the plug-in
#      through the event Local\sorvik-host-restart-<SORVIK_HOST_PID>, as the
#      production script's service restart does, and ends a few seconds
#      later;
#   4. otherwise stays running for SORVIK_FAILOVER_HOLD seconds (default 900,
#      longer than the plug-in's default 600-second limit), giving up early
#      when the host process is gone.
# It takes no arguments, reads nothing from standard input and prints only a
# progress line on standard output.

function Say([string]$text) {
  Add-Content -Path logs\failover.log -Value ('{0} {1}' -f (Get-Date).ToUniversalTime().ToString('yyyy-MM-ddTHH:mm:ssZ'), $text)
}

New-Item -ItemType Directory -Force -Path logs | Out-Null
Say "decommission requested (pid $PID)"
Write-Output 'Decommissioning server'

if ($env:SORVIK_FAILOVER_EXIT) {
  Say "exiting with code $env:SORVIK_FAILOVER_EXIT"
  exit [int]$env:SORVIK_FAILOVER_EXIT
}

$hold = 900
if ($env:SORVIK_FAILOVER_HOLD -match '^\d+$') { $hold = [int]$env:SORVIK_FAILOVER_HOLD }
if ($env:SORVIK_HOST_PID -match '^\d+$' -and $env:SORVIK_FAILOVER_RESTART -ne '0') {
  Say 'asking the host to restart'
  try {
    [void][Threading.EventWaitHandle]::OpenExisting("Local\sorvik-host-restart-$env:SORVIK_HOST_PID").Set()
    $hold = 5
  } catch {
    Say "host process $env:SORVIK_HOST_PID offers no restart event"
  }
}
$elapsed = 0
while ($elapsed -lt $hold) {
  if ($env:SORVIK_HOST_PID -and -not (Get-Process -Id $env:SORVIK_HOST_PID -ErrorAction SilentlyContinue)) { break }
  Start-Sleep -Seconds 1
  $elapsed++
}
Say "sample finished after $elapsed s"
exit 0
