#!/usr/bin/env bash
# The demo: installs what is missing, builds, starts the daemon in a throw-away
# sandbox root, drives it with brisvalectl, then stops it and removes the sandbox.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
BUILD_DIR=build scripts/build.sh -DBRISVALE_BENCH=OFF >/dev/null

if [[ $(id -u) -ne 0 ]]; then
  echo "The demo mounts and chroots: run it as root (sudo scripts/demo.sh)." >&2
  exit 1
fi

daemon=build/src/daemon/brisvale-mounterd
ctl=build/tools/brisvalectl/brisvalectl
sandbox=$(mktemp -d /tmp/brisvale-demo.XXXXXX)
log="$sandbox.log"
daemon_pid=""

cleanup() {
  [[ -n "$daemon_pid" ]] && kill "$daemon_pid" 2>/dev/null && wait "$daemon_pid" 2>/dev/null || true
  "$daemon" --root "$sandbox" --teardown || true
  rm -f "$log"
}
trap cleanup EXIT

step() { printf '\n\033[1m$ %s\033[0m\n' "$*"; "$@" || true; }

echo "Sandbox root: $sandbox"
"$daemon" --root "$sandbox" --verbose >"$log" 2>&1 &
daemon_pid=$!
for _ in $(seq 100); do
  [[ -S "$sandbox/private/var/run/vexa/com.vantrel.brisvale_mounter.vexa" ]] && break
  sleep 0.05
done

step "$ctl" --root "$sandbox" list
step "$ctl" --root "$sandbox" list --json
request=$(mktemp --suffix=.plist)
cat >"$request" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>RequestType</key><string>Sync</string><key>MountPath</key><string>/nowhere</string></dict></plist>
PLIST
step "$ctl" --root "$sandbox" raw "$request"
rm -f "$request"
step "$ctl" --root "$sandbox" post-event com.vantrel.brisvale_mounter.attached
step "$ctl" --root "$sandbox" post-event com.vantrel.example.unknown
sleep 0.2

printf '\n\033[1mDaemon log:\033[0m\n'
cat "$log"
