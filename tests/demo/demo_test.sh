#!/bin/bash
# What the demo adds to the library's own tests: its self-test, the daemon
# as outside programs see it (an echo client, snmpget, qorbu-shm), and a
# clean stop on SIGTERM and SIGINT.
# Usage: demo_test.sh CASE QORBU_DEMO QORBU_SHM
set -u
CASE=$1 DEMO=$2 TOOL=$3
SKIP=77
WORK=$(mktemp -d)
SEGMENT=qorbu-demo-test-$CASE-$$
DAEMON_PID=
FAILURES=0
cleanup() {
    [ -n "$DAEMON_PID" ] && kill -KILL "$DAEMON_PID" 2>/dev/null
    "$TOOL" unlink "$SEGMENT" >/dev/null 2>&1
    rm -rf "$WORK"
}
trap cleanup EXIT

fail() { echo "FAIL: $*"; FAILURES=$((FAILURES + 1)); }
expect() { grep -Eq -- "$2" "$1" || { fail "expected /$2/ in $(basename "$1"):"; sed 's/^/  | /' "$1"; }; }
need_snmpget() { command -v snmpget >/dev/null || { echo "snmpget not installed (apt-get install snmp): skipped"; exit $SKIP; }; }

# Starts the daemon on free ports and waits for its start-up line.
start_daemon() {
    "$DEMO" --port 0 --snmp-port 0 --segment "$SEGMENT" "$@" >"$WORK/out" 2>"$WORK/err" &
    DAEMON_PID=$!
    for _ in $(seq 1 100); do
        grep -q 'echo on 127.0.0.1:' "$WORK/err" && break
        sleep 0.1
    done
    ECHO_PORT=$(sed -n 's/.*echo on 127\.0\.0\.1:\([0-9]*\).*/\1/p' "$WORK/err" | head -1)
    SNMP_PORT=$(sed -n 's/.*SNMP on udp:127\.0\.0\.1:\([0-9]*\).*/\1/p' "$WORK/err" | head -1)
    [ -n "$ECHO_PORT" ] && [ -n "$SNMP_PORT" ] || { fail "the daemon did not start:"; cat "$WORK/err"; exit 1; }
}

# Sends a signal and waits (at most 20 s) for the daemon to exit; its exit
# status goes to DAEMON_STATUS.
stop_daemon() {
    kill -"$1" "$DAEMON_PID"
    for _ in $(seq 1 200); do
        kill -0 "$DAEMON_PID" 2>/dev/null || break
        sleep 0.1
    done
    wait "$DAEMON_PID"
    DAEMON_STATUS=$?
    DAEMON_PID=
}

snmp_value() {
    MIBS= MIBDIRS= snmpget -v2c -c public -On -t 2 -r 2 "udp:127.0.0.1:$SNMP_PORT" \
        "1.3.6.1.4.1.8072.9999.9999.7.$1.0" 2>&1 | sed -n 's/.*: //p'
}

case_self_test() {
    need_snmpget
    local started=$SECONDS
    "$DEMO" --self-test --clients 16 --rounds 32 >"$WORK/out" 2>"$WORK/err"
    local status=$?
    [ "$status" = 0 ] || fail "--self-test exited $status"
    [ $((SECONDS - started)) -le 30 ] || fail "--self-test took $((SECONDS - started)) s"
    expect "$WORK/out" '^  connections +16 of 16 clients connected$'
    expect "$WORK/out" '^  snmpget +open connections 16, bytes echoed [1-9][0-9]*, segment free [0-9]+$'
    expect "$WORK/out" '^  second process +16 records, [1-9][0-9]* bytes'
    expect "$WORK/out" '^  result +PASS: ([0-9]+) of \1 checks held$'
    expect "$WORK/err" 'qorbu-demo: status: '
    expect "$WORK/err" 'qorbu-demo: stopped'
    local pid; pid=$(sed -n 's/^qorbu-demo: pid \([0-9]*\),.*/\1/p' "$WORK/err")
    [ -n "$pid" ] || fail "no start-up line"
    [ -e "/dev/shm/qorbu-demo-selftest-$pid" ] && fail "the self-test's segment was left behind"
    [ "$FAILURES" = 0 ] || { echo "--- stderr"; cat "$WORK/err"; }
}




case_daemon_serves_outside_clients() {
    need_snmpget
    start_daemon --status-interval 200
    exec 3<>"/dev/tcp/127.0.0.1/$ECHO_PORT" || { fail "cannot connect"; return; }
    printf 'hello, qorbu\n' >&3
    local reply=
    read -r -t 10 reply <&3
    [ "$reply" = "hello, qorbu" ] || fail "echo answered '$reply'"
    [ "$(snmp_value 1)" = 1 ] || fail "SNMP open connections: '$(snmp_value 1)', expected 1"
    [ "$(snmp_value 2)" = 13 ] || fail "SNMP bytes echoed: '$(snmp_value 2)', expected 13"
    "$TOOL" info "$SEGMENT" >"$WORK/info" || fail "qorbu-shm info failed"
    expect "$WORK/info" '^useFlock +0$'
    local free; free=$(awk '$1 == "free" { print $2 }' "$WORK/info")
    [ "$(snmp_value 3)" = "$free" ] || fail "SNMP segment free '$(snmp_value 3)', qorbu-shm says '$free'"
    [ "$free" -lt 1048576 ] || fail "the connection's record is not in the segment (free $free)"
    exec 3>&-
    local open=
    for _ in $(seq 1 50); do
        open=$(snmp_value 1)
        [ "$open" = 0 ] && break
        sleep 0.2
    done
    [ "$open" = 0 ] || fail "SNMP open connections after close: '$open'"
    # The status timer re-arms itself: lines keep coming every 200 ms.
    for _ in $(seq 1 100); do
        [ "$(grep -c 'qorbu-demo: status: ' "$WORK/err")" -ge 3 ] && break
        sleep 0.1
    done
    [ "$(grep -c 'qorbu-demo: status: ' "$WORK/err")" -ge 3 ] || fail "fewer than 3 status lines in 10 s"
    stop_daemon TERM
    [ "$DAEMON_STATUS" = 0 ] || fail "exit status $DAEMON_STATUS after SIGTERM"
    "$TOOL" info "$SEGMENT" >/dev/null 2>&1 && fail "the segment was not unlinked"
    [ "$FAILURES" = 0 ] || { echo "--- stderr"; cat "$WORK/err"; }
}

# SIGINT stops the daemon cleanly with a client connected (the outside
# client case stops it with SIGTERM).
case_sigint_stops_cleanly() {
    start_daemon
    exec 3<>"/dev/tcp/127.0.0.1/$ECHO_PORT" || { fail "cannot connect"; return; }
    printf 'x\n' >&3
    local reply=; read -r -t 10 reply <&3
    stop_daemon INT
    [ "$DAEMON_STATUS" = 0 ] || fail "exit status $DAEMON_STATUS after SIGINT"
    expect "$WORK/err" "qorbu-demo: stopping: SIGINT"
    expect "$WORK/err" 'qorbu-demo: stopped'
    local rest=; read -r -t 5 rest <&3; [ $? -gt 128 ] && fail "the connection was left open"
    exec 3>&-
    "$TOOL" info "$SEGMENT" >/dev/null 2>&1 && fail "the segment was not unlinked"
}

"case_$CASE"
if [ "$FAILURES" != 0 ]; then
    echo "$CASE: $FAILURES check(s) failed"
    exit 1
fi
echo "$CASE: all checks held"
