#!/usr/bin/env bash
# The main job: builds everything, then runs the daemon on a fresh private
# root directory until Ctrl-C (or SIGTERM).
#   scripts/run-daemon.sh [ROOT_DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh build

ROOT=${1:-}
if [ -z "$ROOT" ]; then
    ROOT=$(mktemp -d /tmp/kelvo-root-XXXXXX)
fi
mkdir -p "$ROOT/system" "$ROOT/vendor" "$ROOT/data/log/kelvo" "$ROOT/data/property" "$ROOT/dev"
[ -f "$ROOT/system/build.prop" ] || cp config/build.prop "$ROOT/system/build.prop"
mkdir -p "$ROOT/vendor/etc/xml"
[ -f "$ROOT/vendor/etc/xml/tv_kelvo_config.xml" ] ||
    cp config/tv_kelvo_config.xml "$ROOT/vendor/etc/xml/tv_kelvo_config.xml"

echo "kelvod: root $ROOT (Ctrl-C stops it)"
export KELVO_ROOT=$ROOT
exec build/bin/kelvod
