#!/usr/bin/env bash
# Installs what is missing, builds, and runs every test. Integration tests need root
# (they mount and attach loop devices); without it they are skipped with a message.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
BUILD_DIR=build scripts/build.sh -DBRISVALE_BENCH=OFF
cd build
ctest --output-on-failure --timeout 300 -j "${JOBS:-$(nproc)}"
