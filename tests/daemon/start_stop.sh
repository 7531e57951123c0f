#!/usr/bin/env bash
# Starts the daemon on a private root, checks its banner and thread names,
# then stops it with SIGTERM and expects a clean exit within 2 seconds.
set -u
bin=$1
root=$(mktemp -d /tmp/kelvo-daemon-XXXXXX)
log=$root/stderr.log
trap 'rm -rf "$root"' EXIT
# The device's configuration, as every device has one.
mkdir -p "$root/vendor/etc/xml"
cp "$(dirname "$0")/../../config/tv_kelvo_config.xml" "$root/vendor/etc/xml/"

KELVO_ROOT=$root "$bin" 2>"$log" &
pid=$!
for _ in $(seq 1 100); do
    grep -q 'main# Kelvo Daemon' "$log" && break
    sleep 0.05
done
if ! grep -q '\[KelvoMain.cpp\] main# Kelvo Daemon (Version: 000.1.4.0)' "$log"; then
    echo "FAIL: no banner"; cat "$log"; kill -9 $pid; exit 1
fi
# Start-up goes on after the banner: wait (up to 5 s on a loaded machine)
# for the threads.
for _ in $(seq 1 100); do
    names=$(cat /proc/$pid/task/*/comm 2>/dev/null | sort | tr '\n' ' ')
    case " $names " in *" BufferedLogServ "*" HourlyRoutine "*" PollingRoutine "*) break;; esac
    sleep 0.05
done
echo "threads: $names"
for expected in kelvod KelvoStorage BufferedLogServ PollingRoutine HourlyRoutine; do
    case " $names " in *" $expected "*) ;; *) echo "FAIL: no thread $expected"; kill -9 $pid; exit 1;; esac
done
# The buffered log socket lies below the root.
[ -S "$root/dev/socket/KELVO_BUFFERED_LOG" ] || { echo "FAIL: no buffered log socket"; kill -9 $pid; exit 1; }
start=$(date +%s%N)
kill -TERM $pid
for _ in $(seq 1 40); do
    kill -0 $pid 2>/dev/null || break
    sleep 0.05
done
if kill -0 $pid 2>/dev/null; then
    echo "FAIL: still running 2 s after SIGTERM"; kill -9 $pid; exit 1
fi
wait $pid
rc=$?
elapsed=$(( ($(date +%s%N) - start) / 1000000 ))
echo "exit status $rc after ${elapsed} ms"
[ $rc -eq 0 ] || { echo "FAIL: exit status $rc"; cat "$log"; exit 1; }
# A first start on an empty root raises no error line, but for the CPU and
# battery handlers, which stand down on a root without CPU counters or kernel
# device, or without a battery, the Wi-Fi traffic baseline, which finds no
# network counters there, and the GPU and DPM handlers, which find no kernel
# device.
errors=$(grep '^kelvod E ' "$log" | grep -v 'batteryproperties\|registerListener' |
         grep -v '\[CpuHandler.cpp\]\|disable module: 3\|CpuHandler exit\|CpuHandler is pending to exit' |
         grep -v '\[BatteryHandler.cpp\]\|disable module: -1\|BatteryHandler exit\|BatteryHandler is pending to exit' |
         grep -v '\[TrafficReader.cpp\] openView# Failed to open /proc/net/\|\[TrafficCollector.cpp\] takeBaseline#' |
         grep -v 'Failed to open /dev/kelvo\|Failed to open device: /dev/kelvo\|\[GpuHandler.cpp\] lateInitialize#' |
         grep -v 'Failed to open /dev/dpm_ldm\|\[DpmHandler.cpp\] checkEnable#\|disable module: 11\|DpmHandler exit\|DpmHandler is pending to exit' || true)
[ -z "$errors" ] || { echo "FAIL: error lines on a first start:"; echo "$errors"; exit 1; }
echo "PASS"
