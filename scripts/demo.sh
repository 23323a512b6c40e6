#!/usr/bin/env bash
# The demo: installs what is missing, builds, starts the daemon in a throw-away
# sandbox root, drives it with brisvalectl, then stops it and removes the sandbox.
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/as-root.sh
if [[ -z "${BRISVALE_DEMO_BUILT:-}" ]]; then
  scripts/install-deps.sh
  BUILD_DIR=build scripts/build.sh -DBRISVALE_BENCH=OFF >/dev/null
fi

# The demo mounts and chroots: the rest runs as root, through sudo for a user who is
# not (the build above stays the user's own).
if [[ $(id -u) -ne 0 ]]; then
  as_root env BRISVALE_DEMO_BUILT=1 "$PWD/scripts/demo.sh" "$@"
  exit
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

# Simulated hardware: a USB stick with one FAT partition, and a camera.
cat >"$sandbox/devices.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>Objects</key><array>
  <dict><key>Name</key><string>stick</string><key>Class</key><string>KxUSBHostDevice</string>
    <key>Properties</key><dict><key>removable</key><true/></dict>
    <key>Children</key><array>
      <dict><key>Name</key><string>data</string><key>Class</key><string>KxMedia</string>
        <key>Properties</key><dict>
          <key>BSD Name</key><string>sdz1</string><key>Content</key><string>0x0C</string>
          <key>Removable</key><true/><key>Leaf</key><true/><key>Writable</key><true/>
        </dict></dict>
    </array></dict>
  <dict><key>Name</key><string>camera</string><key>Class</key><string>KxUSBHostDevice</string>
    <key>Children</key><array>
      <dict><key>Name</key><string>ptp</string><key>Class</key><string>KxUSBHostInterface</string>
        <key>Properties</key><dict>
          <key>bInterfaceClass</key><integer>6</integer><key>bInterfaceSubClass</key><integer>1</integer>
          <key>bInterfaceProtocol</key><integer>1</integer><key>locationID</key><integer>17825792</integer>
        </dict></dict>
    </array></dict>
</array></dict></plist>
PLIST

echo "Sandbox root: $sandbox"
"$daemon" --root "$sandbox" --devices /devices.plist --verbose >"$log" 2>&1 &
daemon_pid=$!
for _ in $(seq 100); do
  [[ -S "$sandbox/private/var/run/vexa/com.vantrel.brisvale_mounter.vexa" ]] && break
  sleep 0.05
done

# The stick's node holds a FAT boot sector; it is listed, never mounted.
{ printf '\xeb\x3c\x90MSDOS5.0'; head -c 4096 /dev/zero; } >"$sandbox/dev/sdz1"

# A developer image on a loop device at /Developer; the two directories above the
# image file hold the halves of its signature's hex text.
image_dir="$sandbox/private/var/run/images/AB12CD/34EF56"
mkdir -p "$image_dir" "$sandbox/Developer"
mkfs.ext4 -q -O ^has_journal "$image_dir/image.img" 4M
loop=$(losetup --find --show --read-only "$image_dir/image.img")
[[ -e "$sandbox$loop" ]] || mknod "$sandbox$loop" b 7 "${loop#/dev/loop}"
mount -o ro "$loop" "$sandbox/Developer"

step "$ctl" --root "$sandbox" list
step "$ctl" --root "$sandbox" list --json

# Notifications as they arrive, while the image is flushed and taken away again.
"$ctl" --root "$sandbox" watch >"$sandbox.watch" 2>&1 &
watch_pid=$!
sleep 0.2
step "$ctl" --root "$sandbox" sync /Developer
step "$ctl" --root "$sandbox" unmount /Developer
step "$ctl" --root "$sandbox" unmount /private/var/mnt/nothing-here
sleep 0.2
kill "$watch_pid" 2>/dev/null; wait "$watch_pid" 2>/dev/null || true
printf '\n\033[1mbrisvalectl watch saw:\033[0m\n'
cat "$sandbox.watch"; rm -f "$sandbox.watch"
step "$ctl" --root "$sandbox" list
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
