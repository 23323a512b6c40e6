#!/usr/bin/env bash
# Installs the Debian packages the build, the tests and the demo need; quick when
# everything is already there.
set -euo pipefail
source "$(dirname "$0")/as-root.sh"

packages=(
  cmake make g++ pkg-config python3
  libssl-dev openssl libexpat1-dev libudev-dev libblkid-dev libmount-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  clang-16 libclang-rt-16-dev
  e2fsprogs erofs-utils squashfs-tools util-linux attr
)

missing=()
for package in "${packages[@]}"; do
  status=$(dpkg-query -W -f='${Status}' "$package" 2>/dev/null || true)
  [[ "$status" == "install ok installed" ]] || missing+=("$package")
done
[[ ${#missing[@]} -eq 0 ]] && exit 0

echo "Installing: ${missing[*]}"
as_root env DEBIAN_FRONTEND=noninteractive apt-get update -qq
as_root env DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends "${missing[@]}"
