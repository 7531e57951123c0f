#!/usr/bin/env bash
# End to end: the simulator plays examples/e2e-short.scn (one minute across
# 11:00) against the real daemon; the checks read what the daemon left: CPU
# rows per package, the hourly event 903001060 with its component (field 6)
# and top applications (array 7), every package's attributed CPU time against
# the time the scenario gave it, the applications' energy against the
# component's. Then a bad scenario is refused by line before anything starts,
# and an interrupted run leaves no process behind.
#   simulator_e2e.sh KELVO_SIM SOURCE_DIR
set -u
sim=$1
src=$2
work=$(mktemp -d /tmp/kelvo-e2e-XXXXXX)
trap 'rm -rf "$work"' EXIT
root=$work/root
db=$root/data/log/kelvo/kelvo.db
export TZ=UTC

fail() { echo "FAIL: $*"; tail -n 30 "$root/sim/kelvod.log" 2>/dev/null; exit 1; }
q() { sqlite3 "$db" "$1"; }
# Processes whose environment names this root.
leftovers() { grep -lsz "^KELVO_ROOT=$1\$" /proc/[0-9]*/environ 2>/dev/null | grep -v "/proc/$$/"; }

"$sim" --quiet --root "$root" "$src/examples/e2e-short.scn" >"$work/report.txt" 2>"$work/sim.err"
rc=$?
cat "$work/report.txt"
[ $rc = 0 ] || { cat "$work/sim.err"; fail "kelvo-sim exit status $rc"; }
[ -z "$(leftovers "$root")" ] || fail "processes left behind: $(leftovers "$root")"

# The truths of the scenario's header, in ms.
expected="com.example.mail 9800
com.example.browser 10000
com.example.browser-renderer 4400
system_server 6000
kernel_kworker 1000"
attributed() {
    q "SELECT SUM(foreground_time + background_time + charge_foreground_time +
                  charge_background_time) FROM raw_applications_cpu WHERE name = '$1'"
}
while read -r name truth; do
    got=$(attributed "$name")
    [ -n "$got" ] || fail "no raw_applications_cpu row for $name"
    # One clock tick (10 ms) of leeway.
    (( got - truth <= 10 && truth - got <= 10 )) || fail "$name: attributed $got ms, truth $truth ms"
    simTruth=$(awk -F'\t' -v n="$name" '$1 == n { print $3 }' "$root/sim/truth.tsv")
    [ "$simTruth" = "$truth" ] || fail "$name: the simulator's truth is $simTruth ms, not $truth"
    hourly=$(q "SELECT COUNT(*) FROM hourly_applications_cpu WHERE name = '$name'")
    [ "$hourly" -ge 1 ] || fail "no hourly_applications_cpu row for $name"
done <<<"$expected"
others=$(q "SELECT COUNT(*) FROM raw_applications_cpu WHERE name NOT IN
            ('com.example.mail', 'com.example.browser', 'com.example.browser-renderer',
             'system_server', 'kernel_kworker')")
[ "$others" = 0 ] || fail "$others rows for names the scenario never ran"

# In every pass the applications share the component's energy, each record
# rounding by at most 1 (a pass without application time keeps its idle
# energy to the component).
sums="SUM(foreground_energy + background_energy + charge_foreground_energy + charge_background_energy)"
read -r appEnergy appRows <<<"$(q "SELECT $sums, COUNT(*) FROM raw_applications_cpu" | tr '|' ' ')"
componentEnergy=$(q "SELECT $sums FROM raw_component_cpu
                     WHERE end_time IN (SELECT end_time FROM raw_applications_cpu)")
[ "${componentEnergy:-0}" -gt 0 ] || fail "no component energy"
diff=$(( appEnergy - componentEnergy ))
(( diff <= appRows && -diff <= appRows )) ||
    fail "applications' energy $appEnergy, component's $componentEnergy"
[ "$(q "SELECT COUNT(*) FROM hourly_component_cpu")" -ge 1 ] || fail "no hourly_component_cpu row"

# The battery: the cable at the start opens a charging span, the hour has its
# row, and the discharge measured over the spans is the model's within the
# gauge's whole mAh (at most one lost per span).
[ "$(q "SELECT COUNT(*) FROM raw_component_battery
        WHERE charge_screen_on_duration + charge_screen_off_duration > 0")" -ge 1 ] ||
    fail "no charging battery span"
[ "$(q "SELECT COUNT(*) FROM hourly_component_battery")" -ge 1 ] || fail "no hourly battery row"
# The registrar's first report, heard by the handler at the daemon's start,
# opened a discharging span that the cable closed.
[ "$(q "SELECT charge_screen_on_duration + charge_screen_off_duration FROM raw_component_battery
        ORDER BY start_time LIMIT 1")" = 0 ] || fail "the battery's first report opened no span"
read -r measured spans <<<"$(q "SELECT SUM(discharge_screen_on_gas_gauge +
                                  discharge_screen_off_gas_gauge), COUNT(*)
                                  FROM raw_component_battery" | tr '|' ' ')"
drawn=$(sed -n 's/.*the load drew \([0-9.]*\) mAh.*/\1/p' "$work/report.txt")
python3 -c "import sys; m, s, d = int(sys.argv[1]), int(sys.argv[2]), float(sys.argv[3]);
assert abs(m - d) <= s + 1, (m, s, d)" "${measured:-0}" "${spans:-0}" "${drawn:-0}" ||
    fail "battery: measured $measured mAh over $spans spans, the model drew $drawn mAh"

python3 - "$root/data/log/zendrel/events.jsonl" <<'PY' || fail "hourly event"
import json, sys
events = [json.loads(l) for l in open(sys.argv[1]) if l.strip()]
hourly = [e for e in events if e["event"] == 903001060]
assert len(hourly) == 1, "%d hourly events" % len(hourly)
p = hourly[0]["params"]
assert p["0"].endswith("10:00:00") and p["1"].endswith("11:00:00"), (p["0"], p["1"])
component = p["6"]
assert component["class"] == 903009021 and component["params"]["7"] > 0, component
top = p["7"]
names = {a["params"]["3"]["params"]["0"] for a in top}
assert names == {"com.example.mail", "com.example.browser", "com.example.browser-renderer",
                 "system_server", "kernel_kworker"}, names
for a in top:
    assert a["class"] == 903009022 and a["params"]["1"]["class"] == 903009021, a
PY

# A bad scenario is refused by its line before anything starts.
printf 'start 10:00:00\nduration 30\nat 5 screen dim\n' >"$work/bad.scn"
"$sim" --quiet --root "$work/bad-root" "$work/bad.scn" 2>"$work/bad.err"
rc=$?
[ $rc = 2 ] || fail "bad scenario: exit status $rc"
grep -q "bad.scn:3: " "$work/bad.err" || fail "bad scenario: $(cat "$work/bad.err")"
[ ! -e "$work/bad-root" ] || fail "a bad scenario laid out a root"

# Ctrl-C in the middle: an orderly end with status 130 and no process left.
"$sim" --quiet --root "$work/int-root" "$src/examples/e2e-short.scn" >/dev/null 2>&1 &
pid=$!
for _ in $(seq 1 100); do
    [ -S "$work/int-root/dev/socket/KELVO_BUFFERED_LOG" ] && break
    sleep 0.1
done
sleep 2
kill -INT $pid
wait $pid
rc=$?
[ $rc = 130 ] || fail "interrupted run: exit status $rc"
[ -z "$(leftovers "$work/int-root")" ] || fail "left behind after Ctrl-C: $(leftovers "$work/int-root")"
echo "PASS"
