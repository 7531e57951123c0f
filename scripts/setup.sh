#!/usr/bin/env bash
# Prepares a fresh Debian 12 machine and builds the project.
#   scripts/setup.sh [BUILD_DIR] [extra cmake arguments...]
# Installs the Debian packages the build needs (only those missing), then
# configures BUILD_DIR (default: build) and builds it with two jobs: every
# target, or only those named in KELVO_TARGETS (blank-separated).
set -euo pipefail
cd "$(dirname "$0")/.."

PACKAGES=(
    build-essential cmake pkg-config ccache clang libclang-rt-14-dev
    libsqlite3-dev libtinyxml2-dev libjsoncpp-dev
    android-libutils-dev android-libcutils-dev android-liblog-dev
    android-libziparchive-dev android-libbase-dev
    libgtest-dev libgmock-dev libbenchmark-dev
    sqlite3 python3
)

missing=()
for p in "${PACKAGES[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
    echo "Installing: ${missing[*]}"
    SUDO=""
    [ "$(id -u)" -eq 0 ] || SUDO=sudo
    $SUDO apt-get update -qq
    DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y -qq "${missing[@]}" >/dev/null
fi

BUILD_DIR=${1:-build}
shift || true
LAUNCHER=()
command -v ccache >/dev/null && LAUNCHER=(-DCMAKE_C_COMPILER_LAUNCHER=ccache -DCMAKE_CXX_COMPILER_LAUNCHER=ccache)
cmake -S . -B "$BUILD_DIR" "${LAUNCHER[@]}" "$@" >/dev/null
TARGETS=()
for t in ${KELVO_TARGETS:-}; do TARGETS+=(--target "$t"); done
cmake --build "$BUILD_DIR" -j2 "${TARGETS[@]}"
