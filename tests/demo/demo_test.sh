#!/bin/bash
# What the demo adds to the library's own tests: its self-test, and the daemon
# as outside programs see it (an echo client, snmpget, qorbu-shm) up to a
# clean stop on SIGTERM with the client still connected.
# Usage: demo_test.sh CASE QORBU_DEMO QORBU_SHM
set -u
CASE=$1 DEMO=$2 TOOL=$3
WORK=$(mktemp -d)
SEGMENT=qorbu-demo-test-$$
DAEMON_PID=
FAILURES=0
cleanup() {
    [ -n "$DAEMON_PID" ] && kill -KILL "$DAEMON_PID" 2>/dev/null
    "$TOOL" unlink "$SEGMENT" >/dev/null 2>&1
    rm -rf "$WORK"
}
trap cleanup EXIT
fail() { echo "FAIL: $*"; FAILURES=$((FAILURES + 1)); }
expect() { grep -Eq -- "$2" "$1" || fail "expected /$2/ in $(basename "$1")"; }
command -v snmpget >/dev/null || { echo "snmpget not installed (apt-get install snmp): skipped"; exit 77; }

case_self_test() {
    "$DEMO" --self-test --clients 16 --rounds 32 >"$WORK/out" 2>"$WORK/err" || fail "--self-test exited $?"
    expect "$WORK/out" '^  connections +16 of 16 clients connected$'
    expect "$WORK/out" '^  result +PASS: ([0-9]+) of \1 checks held$'
    local pid; pid=$(sed -n 's/^qorbu-demo: pid \([0-9]*\),.*/\1/p' "$WORK/err")
    [ -n "$pid" ] && [ ! -e "/dev/shm/qorbu-demo-selftest-$pid" ] || fail "no start-up line, or the segment was left behind"
}

snmp_value() {
    MIBS= MIBDIRS= snmpget -v2c -c public -On -t 2 -r 4 "udp:127.0.0.1:$SNMP_PORT" \
        "1.3.6.1.4.1.8072.9999.9999.7.$1.0" 2>&1 | sed -n 's/.*: //p'
}

case_outside_client() {
    "$DEMO" --port 0 --snmp-port 0 --segment "$SEGMENT" >"$WORK/out" 2>"$WORK/err" &
    DAEMON_PID=$!
    for _ in $(seq 1 200); do grep -q 'echo on 127.0.0.1:' "$WORK/err" && break; sleep 0.1; done
    local echo_port; echo_port=$(sed -n 's/.*echo on 127\.0\.0\.1:\([0-9]*\).*/\1/p' "$WORK/err" | head -1)
    SNMP_PORT=$(sed -n 's/.*SNMP on udp:127\.0\.0\.1:\([0-9]*\).*/\1/p' "$WORK/err" | head -1)
    [ -n "$echo_port" ] && [ -n "$SNMP_PORT" ] || { fail "the daemon did not start"; return; }

    exec 3<>"/dev/tcp/127.0.0.1/$echo_port" || { fail "cannot connect"; return; }
    printf 'hello, qorbu\n' >&3
    local reply=; read -r -t 20 reply <&3
    [ "$reply" = "hello, qorbu" ] || fail "echo answered '$reply'"
    [ "$(snmp_value 1) $(snmp_value 2)" = "1 13" ] || fail "SNMP: open connections, bytes echoed not 1 13"
    local free; free=$("$TOOL" info "$SEGMENT" | awk '$1 == "free" { print $2 }')
    [ "$(snmp_value 3)" = "$free" ] && [ "$free" -lt 1048576 ] || fail "SNMP segment free: qorbu-shm says '$free'"

    kill -TERM "$DAEMON_PID"
    for _ in $(seq 1 200); do kill -0 "$DAEMON_PID" 2>/dev/null || break; sleep 0.1; done
    wait "$DAEMON_PID"
    local status=$?
    DAEMON_PID=
    [ "$status" = 0 ] || fail "exit status $status after SIGTERM"
    expect "$WORK/err" 'qorbu-demo: stopping: SIGTERM'
    local rest=; read -r -t 5 rest <&3; [ $? -gt 128 ] && fail "the connection was left open"
    exec 3>&-
    "$TOOL" info "$SEGMENT" >/dev/null 2>&1 && fail "the segment was not unlinked"
}

"case_$CASE"
if [ "$FAILURES" != 0 ]; then
    echo "$CASE: $FAILURES check(s) failed; the daemon's output:"
    cat "$WORK/out" "$WORK/err"
    exit 1
fi
echo "$CASE: all checks held"
