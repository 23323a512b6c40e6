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
start_daemon() {
  "$daemon" --root "$sandbox" --devices /devices.plist --verbose >"$log" 2>&1 &
  daemon_pid=$!
}
stop_daemon() {
  [[ -n "$daemon_pid" ]] && kill "$daemon_pid" 2>/dev/null && wait "$daemon_pid" 2>/dev/null || true
}
# scripts/check-unit.sh runs the demo with the daemon started by its service unit.
[[ -n "${BRISVALE_UNIT_DIR:-}" ]] && source scripts/unit-daemon.sh

cleanup() {
  stop_daemon
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
start_daemon
for _ in $(seq 100); do
  [[ -S "$sandbox/private/var/run/vexa/com.vantrel.brisvale_mounter.vexa" ]] && break
  sleep 0.05
done

# The stick's node holds a FAT boot sector; it is listed, never mounted.
{ printf '\xeb\x3c\x90MSDOS5.0'; head -c 4096 /dev/zero; } >"$sandbox/dev/sdz1"

# What a device carries for verified disk images: the developer signing certificate
# and its CA, the running system's version, and the device identity a personalized
# manifest is issued for.
imgtool=build/tools/imgtool/brisvale-imgtool
pki=tests/pki
work=$(mktemp -d /tmp/brisvale-demo-images.XXXXXX)
mkdir -p "$sandbox/System/Library/Tethra" "$sandbox/System/Library/Basalt" "$sandbox/Developer"
cp "$pki/developer-signing.pem" "$sandbox/System/Library/Tethra/CorvexDebug.pem"
cp "$pki/developer-ca.pem" "$sandbox/System/Library/Tethra/CorvexCA.pem"
version_plist() {
  printf '<?xml version="1.0" encoding="UTF-8"?>\n<plist version="1.0"><dict><key>ProductVersion</key><string>%s</string></dict></plist>\n' "$1"
}
version_plist 21.4.1 >"$sandbox/System/Library/Basalt/SystemVersion.plist"
device=(--nonce 00112233445566778899aabbccddeeff --board 8 --chip 0x8030 --ecid 0x1122334455667788
        --production true --security true)
"$imgtool" identity -o "$sandbox/private/var/run/vexa/device-identity.plist" "${device[@]}" --hash-method sha384

# A developer image: an ext4 volume with the version file, a tool, one job that runs
# it, and a trust cache of its executables; signed over its SHA-1 digest.
content="$work/developer"
mkdir -p "$content/System/Library/Basalt" "$content/usr/bin" "$content/Library/OrbitDaemons"
version_plist 21.4.5 >"$content/System/Library/Basalt/SystemVersion.plist"
printf '#!/bin/sh\necho "hello from the developer image"\n' >"$content/usr/bin/hello"
chmod 755 "$content/usr/bin/hello"
cat >"$content/Library/OrbitDaemons/com.vantrel.demo.hello.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>Label</key><string>com.vantrel.demo.hello</string>
  <key>ProgramArguments</key><array><string>/Developer/usr/bin/hello</string></array>
</dict></plist>
PLIST
"$imgtool" trust-cache "$content" -o "$content/.TrustCache"
mkfs.ext4 -q -O ^has_journal -d "$content" "$work/developer.img" 8M
"$imgtool" sign-developer --key "$pki/developer-signing.key" --image "$work/developer.img" -o "$work/developer.sig"
# Notifications as they arrive: the mounts announced, then taken away again.
"$ctl" --root "$sandbox" watch >"$sandbox.watch" 2>&1 &
watch_pid=$!
sleep 0.2
step "$ctl" --root "$sandbox" mount-image --type Developer --signature "$work/developer.sig" "$work/developer.img"
step "$ctl" --root "$sandbox" jobs

# A personalized debug image with a manifest issued for this device: no version check.
content="$work/debug"
mkdir -p "$content/usr/bin"
printf '#!/bin/sh\necho debug\n' >"$content/usr/bin/debug"
chmod 755 "$content/usr/bin/debug"
"$imgtool" trust-cache "$content" -o "$content/.TrustCache"
mkfs.ext4 -q -O ^has_journal -d "$content" "$work/debug.img" 4M
"$imgtool" manifest --image "$work/debug.img" -o "$work/debug.manifest" --sub-type DebugDiskImage "${device[@]}"
step "$ctl" --root "$sandbox" --json mount-image --type Personalized --signature "$work/debug.manifest" "$work/debug.img"
# The same manifest on another image is refused, and the image is consumed all the same.
cp "$work/developer.img" "$work/other.img"
step "$ctl" --root "$sandbox" mount-image --type Personalized --signature "$work/debug.manifest" "$work/other.img"
rm -rf "$work"

step "$ctl" --root "$sandbox" list
step "$ctl" --root "$sandbox" list --json

step "$ctl" --root "$sandbox" sync /Developer
step "$ctl" --root "$sandbox" unmount /Developer
step "$ctl" --root "$sandbox" unmount /private/var/personalized_debug
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
source scripts/demo-media.sh

printf '\n\033[1mDaemon log:\033[0m\n'
cat "$log"
