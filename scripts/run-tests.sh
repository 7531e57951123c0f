#!/usr/bin/env bash
# Builds everything and runs the whole test suite.
#   scripts/run-tests.sh [BUILD_DIR] [extra cmake arguments...]
set -euo pipefail
cd "$(dirname "$0")/.."
BUILD_DIR=${1:-build}
shift || true
scripts/setup.sh "$BUILD_DIR" "$@"
cd "$BUILD_DIR"
ctest -j2 --output-on-failure --timeout 300
