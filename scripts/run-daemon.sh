#!/usr/bin/env bash
# The main job: builds the daemon and the device simulator, then plays a
# scenario on a simulated phone (default examples/main-job.scn: three minutes
# from 10:58:30 across 11:00, so one hourly round runs completely), shows its
# progress and prints the report. Ctrl-C stops it in order, leaving nothing
# running. docs/simulator.md describes the simulator and its scenarios.
#   scripts/run-daemon.sh [SCENARIO] [kelvo-sim options, e.g. --root DIR]
set -euo pipefail
scenario=
args=()
while (($# > 0)); do
    case "$1" in
        --root | --daemon | --config)
            (($# >= 2)) || { echo "run-daemon.sh: $1 needs a value" >&2; exit 2; }
            # Paths are taken from where the command was given.
            args+=("$1" "$(realpath -m "$2")")
            shift 2
            ;;
        -*)
            args+=("$1")
            shift
            ;;
        *)
            [ -z "$scenario" ] || { echo "run-daemon.sh: one scenario only" >&2; exit 2; }
            [ -f "$1" ] || { echo "run-daemon.sh: no scenario file $1" >&2; exit 2; }
            scenario=$(realpath "$1")
            shift
            ;;
    esac
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
