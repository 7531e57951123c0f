#!/usr/bin/env bash
# The main job: builds the daemon and the device simulator, then plays a
# scenario on a simulated phone (default examples/main-job.scn: three minutes
# from 10:58:30 across 11:00, so one hourly round runs completely), shows its
# progress and prints the report. Ctrl-C stops it in order, leaving nothing
# running. docs/simulator.md describes the simulator and its scenarios.
#   scripts/run-daemon.sh [SCENARIO] [kelvo-sim options, e.g. --root DIR]
set -euo pipefail
scenario=${1:-}
shift || true
if [ -n "$scenario" ]; then
    [ -f "$scenario" ] || { echo "run-daemon.sh: no scenario file $scenario" >&2; exit 2; }
    scenario=$(realpath "$scenario")
fi
args=()
for arg in "$@"; do
    # A relative root is taken from where the command was given.
    if [ "${prev:-}" = --root ]; then arg=$(realpath -m "$arg"); fi
    args+=("$arg")
    prev=$arg
done
cd "$(dirname "$0")/.."
scenario=${scenario:-$PWD/examples/main-job.scn}

mkdir -p build
echo "Building kelvod and kelvo-sim (log: build/main-job-build.log) ..."
if ! KELVO_TARGETS="kelvod kelvo-sim" scripts/setup.sh build >build/main-job-build.log 2>&1; then
    tail -n 30 build/main-job-build.log >&2
    echo "run-daemon.sh: the build failed, see build/main-job-build.log" >&2
    exit 1
fi
build/bin/kelvo-sim --check "$scenario"
exec build/bin/kelvo-sim "${args[@]}" "$scenario"
