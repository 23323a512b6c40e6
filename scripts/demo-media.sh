# Removable media in the demo, sourced by scripts/demo.sh with its $ctl, $sandbox and
# step(): an HFS+ stick plugged in, checked, repaired and mounted by the tool doubles,
# listed, then pulled out and taken away; an NTFS stick whose mount-failure alert an
# auto-answering agent shows; the camera announced. brisvalectl watch shows the
# notifications.
doubles=scripts/doubles
mkdir -p "$sandbox/sbin"
cp "$doubles/fsck_hfs" "$doubles/mount_hfs" "$sandbox/sbin/"

# The devices file as it was, with the sticks named here added below it.
write_devices() {
  local extra=""
  for bsd in "$@"; do
    extra+="<dict><key>Name</key><string>usb-$bsd</string><key>Class</key><string>KxUSBHostDevice</string>
      <key>Properties</key><dict><key>removable</key><true/></dict><key>Children</key><array>
      <dict><key>Name</key><string>$bsd</string><key>Class</key><string>KxMedia</string><key>Properties</key><dict>
        <key>BSD Name</key><string>$bsd</string><key>Content</key><string>48465300-0000-11AA-AA11-00306543ECAC</string>
        <key>Removable</key><true/><key>Leaf</key><true/><key>Writable</key><true/></dict></dict></array></dict>"
  done
  sed "s|</array></dict></plist>|$(printf '%s' "$extra" | tr -d '\n')</array></dict></plist>|" \
    "$sandbox/devices.base.plist" >"$sandbox/devices.plist"
}
cp "$sandbox/devices.plist" "$sandbox/devices.base.plist"
"$doubles/make-volume" "$sandbox/dev/sdy1" hfs+ dirty
"$doubles/make-volume" "$sandbox/dev/sdx1" ntfs

"$ctl" --root "$sandbox" watch >"$sandbox.media-watch" 2>&1 &
media_watch_pid=$!
sleep 0.2

printf '\n\033[1mAn HFS+ stick is plugged in:\033[0m\n'
write_devices sdy1
step "$ctl" --root "$sandbox" post-event com.vantrel.brisvale_mounter.attached
sleep 0.5
step "$ctl" --root "$sandbox" list
step findmnt -n -o SOURCE,FSTYPE,OPTIONS "$sandbox/private/var/mnt/mount1"

printf '\n\033[1mIt is pulled out without an eject:\033[0m\n'
write_devices
step "$ctl" --root "$sandbox" post-event com.vantrel.brisvale_mounter.detached
sleep 0.3
step "$ctl" --root "$sandbox" list
step ls "$sandbox/private/var/mnt"

printf '\n\033[1mAn NTFS stick cannot be mounted; the alert agent shows why:\033[0m\n'
"$ctl" --root "$sandbox" --auto-dismiss 1 alert-agent >"$sandbox.agent" 2>&1 &
agent_pid=$!
sleep 0.3
write_devices sdx1
step "$ctl" --root "$sandbox" post-event com.vantrel.brisvale_mounter.attached
sleep 1.5
kill "$agent_pid" 2>/dev/null; wait "$agent_pid" 2>/dev/null || true
cat "$sandbox.agent"; rm -f "$sandbox.agent"

printf '\n\033[1mThe camera is announced:\033[0m\n'
step "$ctl" --root "$sandbox" post-event com.vantrel.mobile.ptp_camera
sleep 0.3
kill "$media_watch_pid" 2>/dev/null; wait "$media_watch_pid" 2>/dev/null || true
printf '\n\033[1mbrisvalectl watch saw:\033[0m\n'
cat "$sandbox.media-watch"; rm -f "$sandbox.media-watch"
