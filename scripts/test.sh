#!/usr/bin/env bash
# Installs what is missing, builds, and runs every test. Integration tests need root
# (they mount and attach loop devices): a user who is not root runs them through sudo
# when it is installed; without either they are skipped with a message.
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/as-root.sh
scripts/install-deps.sh
BUILD_DIR=build scripts/build.sh -DBRISVALE_BENCH=OFF
cd build
run_tests=(ctest --output-on-failure --timeout 300 -j "${JOBS:-$(nproc)}")
if [[ $(id -u) -ne 0 ]] && command -v sudo >/dev/null 2>&1; then
  as_root "${run_tests[@]}"
else
  "${run_tests[@]}"
fi
