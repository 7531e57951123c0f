#!/usr/bin/env bash
# An orderly stop keeps the buffered rows. The first start meets an old
# database (tables, no schema versions) and rebuilds it; on a beta device the
# rebuild's daily upload queues a debug_upload_result row, which waits in the
# insert buffer (the flush period is minutes). SIGTERM comes at once. The
# second start must find that row and keep the database as it is. Last, a
# database that is no database: the start fails, the file is moved aside and
# the process ends with status 0 at once.
set -u
bin=$1
root=$(mktemp -d /tmp/kelvo-stop-XXXXXX)
trap 'rm -rf "$root"' EXIT
db=$root/data/log/kelvo/kelvo.db
mkdir -p "$root/system" "$(dirname "$db")"
echo "ro.logsystem.usertype=3" >"$root/system/build.prop"
sqlite3 "$db" "CREATE TABLE legacy(v INTEGER);"

fail() { echo "FAIL: $*"; cat "$root"/start*.log; exit 1; }

# Starts the daemon, waits for the end of its storage start, stops it.
run() {
    local log=$root/start$1.log
    KELVO_ROOT=$root "$bin" 2>"$log" &
    local pid=$!
    for _ in $(seq 1 100); do
        grep -q 'KELVO library starting' "$log" && break
        sleep 0.05
    done
    grep -q 'KELVO library starting' "$log" || { kill -9 $pid; fail "start $1 did not finish"; }
    kill -TERM $pid
    for _ in $(seq 1 100); do
        kill -0 $pid 2>/dev/null || break
        sleep 0.05
    done
    kill -0 $pid 2>/dev/null && { kill -9 $pid; fail "still running 5 s after SIGTERM"; }
    wait $pid || fail "start $1 exit status $?"
}

rows() { sqlite3 "$db" "SELECT COUNT(*) FROM debug_upload_result WHERE eventid = 903999001"; }
zips() { ls "$root/data/log/kelvo/backup" | grep -c '\.zip$'; }

run 1
grep -q 'Domestic beta user, upload database success' "$root/start1.log" || fail "no rebuild"
[ "$(rows)" = 1 ] || fail "the buffered row was lost: $(rows) rows"
[ "$(zips)" = 1 ] || fail "$(zips) backups after the rebuild"

run 2
grep -q 'Domestic beta user' "$root/start2.log" && fail "the second start rebuilt again"
[ "$(rows)" = 1 ] || fail "$(rows) rows after the second start"
[ "$(zips)" = 1 ] || fail "$(zips) backups after the second start"
rm -rf "$root/data/log/kelvo"
mkdir -p "$(dirname "$db")"
head -c 8192 /dev/zero | tr '\0' 'Z' >"$db"
KELVO_ROOT=$root timeout 20 "$bin" 2>"$root/start3.log"
rc=$?
[ $rc = 0 ] || fail "a failed start ended with status $rc"
grep -q 'Failed to start storage' "$root/start3.log" || fail "the start did not fail"
grep -q 'Failed to remove file' "$root/start3.log" && fail "deleted a file already moved aside"
moved=$(ls "$root/data/log/kelvo/backup")
[ "$(head -c 4 "$root/data/log/kelvo/backup/$moved")" = ZZZZ ] || fail "not moved aside: $moved"
echo "PASS"
