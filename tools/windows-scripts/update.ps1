# Sample installation script for the Windows package, for sorvik-host.exe
# (the production script belongs to the server's own installer).
#
#   update.ps1 BUNDLE
#
# BUNDLE is a zip archive holding sorvik.dll. The script runs in the host's
# working directory and:
#   1. starts logs\update.log afresh (the plug-in reads it at its next start
#      and takes any "Update failed" line as a failed update);
#   2. unpacks sorvik.dll into a private directory, renames the installed
#      library aside (Windows lets a loaded DLL be renamed, not overwritten)
#      and moves the new one into its place;
#   3. once update.xml carries the plug-in's pending mark, asks the host to
#      restart the plug-in through the event
#      Local\sorvik-host-restart-<SORVIK_HOST_PID>;
#   4. stays until the restarted plug-in has rewritten update.xml without the
#      mark, so the old instance never sees this script end.
#
# Exit codes, as the plug-in reports them negated:
#   0  installed and the plug-in restarted (not seen by the plug-in)
#   20 INSTALL_ERROR: bad arguments, no host to restart, file errors
#   21 INSTALL_TIMEOUT: the plug-in did not come back in time
#   23 INSTALL_VERIFY_FAILED: the bundle does not unpack to a library
#
# Environment: SORVIK_HOST_PID (set by sorvik-host.exe); SORVIK_UPDATE_TARGET,
# the library to replace (default .\sorvik.dll); SORVIK_UPDATE_RESTART_WAIT,
# seconds to wait for the restart (default 60).

param([string]$Bundle)

$log = 'logs\update.log'
$target = if ($env:SORVIK_UPDATE_TARGET) { $env:SORVIK_UPDATE_TARGET } else { '.\sorvik.dll' }
$restartWait = 60
if ($env:SORVIK_UPDATE_RESTART_WAIT -match '^\d+$') { $restartWait = [int]$env:SORVIK_UPDATE_RESTART_WAIT }

New-Item -ItemType Directory -Force -Path logs | Out-Null
Set-Content -Path $log -Value $null -NoNewline

function Say([string]$text) {
  Add-Content -Path $log -Value ('{0} {1}' -f (Get-Date).ToUniversalTime().ToString('yyyy-MM-ddTHH:mm:ssZ'), $text)
}
function Fail([int]$code, [string]$text) {
  Say "Update failed: $text"
  exit $code
}
function Pending { (Test-Path update.xml) -and ((Get-Content -Raw update.xml) -match 'PendingUpdate="1"') }

if (-not $Bundle) { Fail 20 'expected the bundle path as the only argument' }
Say "installing bundle $Bundle (pid $PID)"
if (-not (Test-Path -PathType Leaf $Bundle)) { Fail 20 "bundle not found: $Bundle" }
if ($env:SORVIK_HOST_PID -notmatch '^\d+$') { Fail 20 'SORVIK_HOST_PID is not set; no host to restart' }
try {
  $restart = [Threading.EventWaitHandle]::OpenExisting("Local\sorvik-host-restart-$env:SORVIK_HOST_PID")
} catch {
  Fail 20 "host process $env:SORVIK_HOST_PID offers no restart event"
}

$work = Join-Path ([IO.Path]::GetTempPath()) ("sorvik-update-" + [Guid]::NewGuid())
New-Item -ItemType Directory -Path $work | Out-Null
try {
  # Only the one member is taken: nothing else in the archive is written anywhere.
  try {
    Add-Type -AssemblyName System.IO.Compression.FileSystem
    $zip = [IO.Compression.ZipFile]::OpenRead((Resolve-Path $Bundle))
    $entry = $zip.Entries | Where-Object { $_.FullName -eq 'sorvik.dll' } | Select-Object -First 1
    if (-not $entry -or $entry.Length -eq 0) { $zip.Dispose(); Fail 23 'bundle holds no non-empty sorvik.dll' }
    [IO.Compression.ZipFileExtensions]::ExtractToFile($entry, (Join-Path $work 'sorvik.dll'))
    $zip.Dispose()
  } catch {
    Fail 23 "bundle is not a zip archive holding sorvik.dll: $_"
  }

  $staged = "$target.new.$PID"
  $aside = "$target.old.$PID"
  try {
    Copy-Item (Join-Path $work 'sorvik.dll') $staged
    if (Test-Path $target) { Move-Item -Force $target $aside }
    Move-Item -Force $staged $target
  } catch {
    Remove-Item -ErrorAction SilentlyContinue $staged
    if ((-not (Test-Path $target)) -and (Test-Path $aside)) { Move-Item $aside $target }
    Fail 20 "cannot put the new library in place: $_"
  }
  Say "installed $target"
} finally {
  Remove-Item -Recurse -Force -ErrorAction SilentlyContinue $work
}

# The plug-in marks the update as pending right after starting this script;
# restarting it before that would lose the mark.
$deadline = (Get-Date).AddSeconds($restartWait)
while (-not (Pending)) {
  if ((Get-Date) -gt $deadline) { Fail 20 'update.xml never showed the pending update' }
  Start-Sleep -Seconds 1
}
[void]$restart.Set()
Say "asked host $env:SORVIK_HOST_PID to restart the plug-in"

$deadline = (Get-Date).AddSeconds($restartWait)
while (Pending) {
  if ((Get-Date) -gt $deadline) { Fail 21 "plug-in did not restart within $restartWait s" }
  Start-Sleep -Seconds 1
}
Say 'plug-in restarted with the new library'
exit 0
