#!/usr/bin/env bash
# Runs the demo with the daemon under its systemd service unit, so that every hardening
# option there (system-call filter, device access, capabilities) meets the daemon's
# real work: image and volume mounts, loop devices, tools, alerts. The service manager
# boots in new PID and mount namespaces of its own, so this works on a machine whose
# init is not systemd, and nothing it mounts is seen outside. Needs root and systemd.
set -euo pipefail
cd "$(dirname "$0")/.."
[[ $(id -u) -eq 0 ]] || { echo "check-unit.sh: run as root" >&2; exit 1; }
[[ -x /lib/systemd/systemd ]] || { echo "check-unit.sh: systemd is not installed" >&2; exit 1; }
[[ -x build/src/daemon/brisvale-mounterd ]] || BUILD_DIR=build scripts/build.sh -DBRISVALE_BENCH=OFF >/dev/null

units=$(mktemp -d /tmp/brisvale-units.XXXXXX)
printf '[Unit]\nDescription=the unit check\nDefaultDependencies=no\n' >"$units/brisvale-check.target"
setsid unshare --pid --fork --mount --propagation private --mount-proc \
  env SYSTEMD_UNIT_PATH="$units" container=brisvale-check \
  /lib/systemd/systemd --system --unit=brisvale-check.target >/dev/null 2>&1 &
launcher=$!  # unshare, whose one child is the manager
manager=""
finish() {
  # Killing the namespace's first process ends every process left in it.
  [[ -n "$manager" ]] && kill -KILL "$manager" 2>/dev/null
  rm -rf "$units"
}
trap finish EXIT
for _ in $(seq 100); do
  manager=$(pgrep -P "$launcher" || true)
  [[ -n "$manager" ]] && nsenter -t "$manager" -a systemctl is-system-running >/dev/null 2>&1 && break
  sleep 0.1
done
[[ -n "$manager" ]] || { echo "check-unit.sh: the service manager did not start" >&2; exit 1; }

out="$units/demo.out"
nsenter -t "$manager" -a --wd="$PWD" env BRISVALE_UNIT_DIR="$units" BRISVALE_DEMO_BUILT=1 \
  scripts/demo.sh >"$out" 2>&1
# The demo goes on past a failed step, so its outcomes are checked here: each line is
# one piece of work the unit's options could break.
missing=0
while IFS= read -r expected; do
  grep -qF -- "$expected" "$out" || { echo "check-unit.sh: missing: $expected" >&2; missing=1; }
done <<'EXPECTED'
debug: Attempting destruction of /private/var/mnt/stale.
default: Successfully mounted /Developer
com.vantrel.demo.hello  /Developer/usr/bin/hello
"MountPath": "/private/var/personalized_debug"
Sync /Developer: done
Unmount /Developer: done
Unmount /private/var/personalized_debug: done
default: Successfully mounted /var/mnt/mount1.
[alert 1] answered
com.vantrel.mobile.camera_attached
EXPECTED
if [[ $missing -ne 0 ]]; then cat "$out" >&2; exit 1; fi
echo "check-unit.sh: the demo did all its work under the service unit"
