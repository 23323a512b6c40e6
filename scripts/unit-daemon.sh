# Sourced by scripts/demo.sh under scripts/check-unit.sh: starts and stops the demo's
# daemon as the installed service unit would run it, with the unit's own hardening, in
# the service manager that check-unit.sh booted. Only what a sandbox needs is changed:
# the command line, where its output goes, and making the sandbox's own device nodes.
start_daemon() {
  local unit="$BRISVALE_UNIT_DIR/brisvale-mounterd.service"
  sed -e "s|^ExecStart=.*|ExecStart=$PWD/$daemon --root $sandbox --devices /devices.plist --verbose|" \
      -e '/^Requires=/d;/^After=/d;/^Restart=/d' \
      -e 's|^\[Unit\]|[Unit]\nDefaultDependencies=no|' \
      dist/systemd/brisvale-mounterd.service.in >"$unit"
  printf '%s\n' "StandardOutput=append:$log" "StandardError=append:$log" \
    "DeviceAllow=char-misc rwm" "DeviceAllow=char-mem rwm" >>"$unit"
  # A stale tree left by an earlier run, for the start-up clean-up's walk.
  mkdir -p "$sandbox/private/var/mnt/stale/a" && echo x >"$sandbox/private/var/mnt/stale/a/file"
  systemctl daemon-reload
  systemctl start brisvale-mounterd.service
}
stop_daemon() {
  systemctl stop brisvale-mounterd.service 2>/dev/null || true
}
