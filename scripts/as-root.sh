# Sourced by the scripts that need root for part of their work. `as_root CMD...` runs
# CMD directly as root, through sudo when it is installed, and otherwise fails with a
# message that says what to do.
as_root() {
  if [[ $(id -u) -eq 0 ]]; then
    "$@"
  elif command -v sudo >/dev/null 2>&1; then
    sudo "$@"
  else
    echo "$(basename "$0"): '$1' needs root and sudo is not installed: run this script as root." >&2
    return 1
  fi
}
