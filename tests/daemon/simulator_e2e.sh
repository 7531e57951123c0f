#!/usr/bin/env bash
# End to end: the simulator plays examples/e2e-short.scn (one minute across
# 11:00) against the real daemon; the checks read what the daemon left: CPU
# rows per package, the hourly event 903001060 with its component (field 6)
# and top applications (array 7), every package's attributed CPU time against
# the time the scenario gave it, the applications' energy against the
# component's; backlight, GNSS and flashlight time and energy per application
# against the scenario's, with their hourly rows and upload fields. Then a bad scenario is refused by line before anything starts,
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
traffic=$(awk -F'\t' '$1 == "com.example.mail" { print $3 "/" $4 }' "$root/sim/traffic-truth.tsv")
[ "$traffic" = "150000/4000" ] || fail "com.example.mail: the simulator's traffic truth is $traffic"
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

# Display, GNSS and flashlight per application (the truths of the scenario's
# header): the time exactly, as the records carry the scenario's times; the
# energy within 3 units, as the daemon truncates every interval it accounts
# (cut by each brightness, foreground, screen and charger change and the hour).
expected="backlight com.example.mail 15000 1470
backlight com.example.browser 25000 3800
gnss com.example.mail 20000 525
gnss com.example.browser 25000 700
flashlight com.example.mail 10000 1800"
componentSql() {
    if [ "$1" = backlight ]; then
        echo "SELECT SUM(duration + charge_duration), SUM(energy + charge_energy)
              FROM raw_applications_backlight WHERE name = '$2'"
    else
        echo "SELECT SUM(foreground_duration + background_duration + charge_foreground_duration +
                         charge_background_duration),
                     SUM(foreground_energy + background_energy + charge_foreground_energy +
                         charge_background_energy) FROM raw_applications_$1 WHERE name = '$2'"
    fi
}
while read -r component name ms energy; do
    read -r gotMs gotEnergy <<<"$(q "$(componentSql "$component" "$name")" | tr '|' ' ')"
    [ -n "$gotMs" ] || fail "no raw_applications_$component row for $name"
    (( gotMs == ms )) || fail "$component $name: attributed $gotMs ms, truth $ms ms"
    (( gotEnergy - energy <= 3 && energy - gotEnergy <= 3 )) ||
        fail "$component $name: attributed energy $gotEnergy, truth $energy"
    simTruth=$(awk -F'\t' -v c="$component" -v n="$name" '$1 == c && $2 == n { print $3, $5 }' \
        "$root/sim/components.tsv")
    [ "$simTruth" = "$ms $energy" ] || fail "$component $name: the simulator's truth is $simTruth"
    hourly=$(q "SELECT COUNT(*) FROM hourly_applications_$component WHERE name = '$name'")
    [ "$hourly" -ge 1 ] || fail "no hourly_applications_$component row for $name"
done <<<"$expected"
others=$(q "SELECT (SELECT COUNT(*) FROM raw_applications_gnss WHERE name NOT IN
                    ('com.example.mail', 'com.example.browser')) +
                   (SELECT COUNT(*) FROM raw_applications_flashlight WHERE name != 'com.example.mail') +
                   (SELECT COUNT(*) FROM raw_applications_backlight WHERE name NOT IN
                    ('com.example.mail', 'com.example.browser', 'screen_off',
                     'com.tovaro.android.launcher'))")
[ "$others" = 0 ] || fail "$others display, GNSS or flashlight rows for names the scenario never used"
ambient=$(q "SELECT SUM(duration) FROM raw_ambient_light WHERE type = 0")
[ "$ambient" = 3500 ] || fail "ambient light: $ambient ms stored, 3500 written"
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
# Display (4, 5), GNSS (8, 9) and flashlight (18, 19): all were in use before 11:00.
for field, array, users in ((4, 5, {"com.example.mail", "com.example.browser"}),
                            (8, 9, {"com.example.mail", "com.example.browser"}),
                            (18, 19, {"com.example.mail"})):
    assert p[str(field)]["class"] == 903009021, (field, p.get(str(field)))
    names = {a["params"]["3"]["params"]["0"] for a in p[str(array)]}
    assert names == users, (array, names)
PY

# Wi-Fi: the hotspot's 10 s at 160, com.example.mail's bytes, its scans and
# its part of the band's fixed power (about 29 s x 40 / 1000), hourly rows
# and the hourly event's Wi-Fi component (25) and top applications (26).
[ "$(q "SELECT background_duration || '/' || background_energy FROM raw_applications_wifi
        WHERE name = 'wifi_ap'")" = "10000/1600" ] || fail "no hotspot record"
read -r mailBytes mailEnergy <<<"$(q "SELECT SUM(foreground_tx_bytes + foreground_rx_bytes +
    background_tx_bytes + background_rx_bytes), SUM(foreground_energy + background_energy)
    FROM raw_applications_wifi WHERE name = 'com.example.mail'" | tr '|' ' ')"
[ "$mailBytes" = 150000 ] || fail "com.example.mail: $mailBytes Wi-Fi bytes"
(( mailEnergy > 1000 && mailEnergy < 1700 )) || fail "com.example.mail: Wi-Fi energy $mailEnergy"
[ "$(q "SELECT COUNT(*) FROM hourly_applications_wifi WHERE name = 'com.example.mail'")" = 1 ] ||
    fail "no hourly_applications_wifi row"
python3 - "$root/data/log/zendrel/events.jsonl" <<'PY' || fail "hourly Wi-Fi upload"
import json, sys
events = [json.loads(l) for l in open(sys.argv[1]) if l.strip()]
p = [e for e in events if e["event"] == 903001060][0]["params"]
assert p["25"]["class"] == 903009021 and p["25"]["params"]["13"] == 100000, p["25"]
assert p["26"][0]["params"]["3"]["params"]["0"] == "com.example.mail", p["26"]
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
