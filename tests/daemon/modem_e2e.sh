#!/usr/bin/env bash
# End to end: the simulator plays examples/modem.scn (two minutes across
# 11:00) against the real daemon, whose modem asks for statistics through the
# control file and gets them over the manager service. The checks read what
# the daemon left: the module tables, idle, voice and data energy of
# raw_component_modem against the simulator's truth, each application's
# cellular bytes and data energy in raw_applications_modem, and the requests
# left unanswered or answered with a broken block.
# Exit 77 (skipped) when the daemon has no modem tables at all.
#   modem_e2e.sh KELVO_SIM SOURCE_DIR
set -u
sim=$1
src=$2
work=$(mktemp -d /tmp/kelvo-modem-XXXXXX)
trap 'rm -rf "$work"' EXIT
root=$work/root
db=$root/data/log/kelvo/kelvo.db
export TZ=UTC

fail() { echo "FAIL: $*"; tail -n 30 "$root/sim/kelvod.log" 2>/dev/null; exit 1; }
q() { sqlite3 "$db" "$1"; }

"$sim" --quiet --root "$root" "$src/examples/modem.scn" >"$work/report.txt" 2>"$work/sim.err"
rc=$?
cat "$work/report.txt"
[ $rc = 0 ] || { cat "$work/sim.err"; fail "kelvo-sim exit status $rc"; }
if [ "$(q "SELECT COUNT(*) FROM sqlite_master WHERE name = 'raw_component_modem'")" != 1 ]; then
    echo "SKIP: this daemon keeps no modem tables"
    exit 77
fi
truth=$root/sim/modem-truth.tsv

# The scenario's residency in ms (its header).
for expected in "idle 85000" "voice 25000" "data 39125"; do
    set -- $expected
    got=$(awk -F'\t' -v k="$1" '$1 == "component" && $2 == k { print $3 }' "$truth")
    [ "$got" = "$2" ] || fail "$1: the simulator's truth is $got ms, not $2"
done
grep -q "Modem: [0-9]* requests, [0-9]* answers (1 malformed)" "$work/report.txt" ||
    fail "no malformed answer in the report"

# Every module the modem reported has its rows.
for table in lte_phy lte_rrc wcdma_phy driver; do
    [ "$(q "SELECT COUNT(*) FROM raw_modem_$table")" -ge 1 ] || fail "no raw_modem_$table row"
done

# Idle (1), voice (0) and data (2) time and energy: the energy within one
# unit per record and kind (each action truncates).
for kind in "idle 1" "voice 0" "data 2"; do
    set -- $kind
    read -r ms energy <<<"$(awk -F'\t' -v k="$1" '$1 == "component" && $2 == k { print $3, $4 }' "$truth")"
    read -r gotMs gotEnergy <<<"$(q "SELECT SUM(duration + charge_duration),
        SUM(energy + charge_energy) FROM raw_component_modem WHERE type = $2" | tr '|' ' ')"
    [ "${gotMs:-0}" = "$ms" ] || fail "$1: raw_component_modem holds ${gotMs:-0} ms, truth $ms"
    (( ${gotEnergy:-0} - energy <= 3 && energy - ${gotEnergy:-0} <= 3 )) ||
        fail "$1: raw_component_modem holds ${gotEnergy:-0} energy, truth $energy"
done

# Per application: the cellular bytes, and the data energy split by packets.
groups="foreground background charge_foreground charge_background"
bytes=$(for g in $groups; do printf '%s_tx_bytes + %s_rx_bytes + ' "$g" "$g"; done)
energy=$(for g in $groups; do printf '%s_energy + ' "$g"; done)
while IFS=$'\t' read -r kind name uid packets appBytes appEnergy; do
    [ "$kind" = app ] || continue
    read -r gotBytes gotEnergy <<<"$(q "SELECT SUM(${bytes}0), SUM(${energy}0)
        FROM raw_applications_modem WHERE name = '$name'" | tr '|' ' ')"
    [ "${gotBytes:-0}" = "$appBytes" ] || fail "$name: ${gotBytes:-0} bytes accounted, $appBytes sent"
    (( ${gotEnergy:-0} - appEnergy <= 2 && appEnergy - ${gotEnergy:-0} <= 2 )) ||
        fail "$name: ${gotEnergy:-0} data energy accounted, truth $appEnergy"
done <"$truth"
[ "$(awk -F'\t' '$1 == "app"' "$truth" | wc -l)" = 2 ] || fail "not two cellular apps in the truth"
echo "PASS"
