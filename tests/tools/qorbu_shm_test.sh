#!/bin/bash
# qorbu-shm, driven as a script would drive it: outputs, exit codes and the
# one-line errors. Usage: qorbu_shm_test.sh CASE QORBU_SHM SHM_POKE DATA_ADDRESS
set -u
CASE=$1 TOOL_BIN=$2 POKE_BIN=$3 ADDRESS=$4
# Cross builds run the programs under their emulator (QORBU_TEST_EMULATOR).
EMULATOR=(${QORBU_TEST_EMULATOR:-})
tool() { "${EMULATOR[@]}" "$TOOL_BIN" "$@"; }
poke() { "${EMULATOR[@]}" "$POKE_BIN" "$@"; }
TOOL=tool POKE=poke
NAME=qorbu-shm-test-$CASE-$$
FAILURES=0
OUT=$(mktemp) ERR=$(mktemp)
trap '"$TOOL" unlink "$NAME" >/dev/null 2>&1; rm -f "$OUT" "$ERR"' EXIT

# run EXPECTED_STATUS ARGS...: runs the tool, keeps stdout/stderr in $OUT/$ERR
run() {
    local expected=$1; shift
    "$TOOL" "$@" >"$OUT" 2>"$ERR"
    local status=$?
    if [ "$status" != "$expected" ]; then
        echo "FAIL: qorbu-shm $* exited $status, expected $expected"
        sed 's/^/  stdout: /' "$OUT"; sed 's/^/  stderr: /' "$ERR"
        FAILURES=$((FAILURES + 1))
    fi
}
# expect FILE PATTERN: grep -E PATTERN must match in FILE
expect() {
    if ! grep -Eq -- "$2" "$1"; then
        echo "FAIL: expected /$2/ in $(basename "$1" | sed "s|$(basename "$OUT")|stdout|;s|$(basename "$ERR")|stderr|"):"
        sed 's/^/  | /' "$1"
        FAILURES=$((FAILURES + 1))
    fi
}
# one_line_error PATTERN: stderr is exactly one line, "qorbu-shm: ..." matching
one_line_error() {
    if [ "$(wc -l <"$ERR")" != 1 ] || ! grep -Eq -- "^qorbu-shm: .*$1" "$ERR"; then
        echo "FAIL: expected one error line matching /$1/, got:"; sed 's/^/  | /' "$ERR"
        FAILURES=$((FAILURES + 1))
    fi
}
field() { awk -v k="$1" '$1 == k { print $2 }' "$OUT"; }
check_field() {
    local value; value=$(field "$1")
    if [ "$value" != "$2" ]; then
        echo "FAIL: info field $1 is '$value', expected '$2'"; FAILURES=$((FAILURES + 1))
    fi
}

case_help() {
    run 0 --help
    expect "$OUT" '^usage: qorbu-shm COMMAND'
    expect "$OUT" 'Exit status: 0 success'
    run 2
    expect "$ERR" '^usage: qorbu-shm'
    run 2 frobnicate x;        one_line_error "unknown command 'frobnicate'"
    run 2 info;                one_line_error 'usage: qorbu-shm info NAME'
    run 2 create "$NAME";      one_line_error 'usage: qorbu-shm create NAME SIZE'
    run 2 unlink a b;          one_line_error 'usage: qorbu-shm unlink NAME'
}

case_create_info_unlink() {
    run 0 create "$NAME" 20480
    expect "$OUT" "^created $NAME: header 0x[0-9a-f]+, data 0x[0-9a-f]+, 24576 bytes in all, 20480 data bytes free$"
    run 0 info "$NAME"
    check_field size 24576; check_field free 20480; check_field largest 16384
    check_field useFlock 0; check_field busy 0; check_field blocks 2
    run 5 create "$NAME" 4096; one_line_error "segment '$NAME' exists already"
    run 0 unlink "$NAME"
    run 3 info "$NAME";        one_line_error "no segment named '$NAME'"
    run 3 unlink "$NAME";      one_line_error "no segment named '$NAME'"
}

case_create_at_address() {
    run 0 create "$NAME" 8k "$ADDRESS"
    run 0 info "$NAME"
    check_field base "$(printf '%#x' $((ADDRESS - 4096)))"; check_field data "$ADDRESS"; check_field free 8192
    run 0 dump "$NAME"
    expect "$OUT" "^0x00002000 \\[10\\] = \\{ $ADDRESS \\}\$"
}

case_bad_arguments() {
    for bad in "" "a/b" "a:b"; do
        run 2 create "$bad" 4096; one_line_error "invalid segment name '$bad'"
        run 2 info "$bad";        one_line_error "invalid segment name"
        run 2 unlink "$bad";      one_line_error "invalid segment name"
    done
    run 2 create "$NAME" 0;              one_line_error "invalid size '0'"
    run 2 create "$NAME" 12x;            one_line_error "invalid size '12x'"
    run 2 create "$NAME" -5;             one_line_error "invalid size '-5'"
    run 2 create "$NAME" 4096 0x1001;    one_line_error "invalid address '0x1001'"
    run 3 info "$NAME"   # nothing was created by the refused calls
}

case_missing_segment() {
    for command in info dump unlink; do
        run 3 $command "$NAME"; one_line_error "no segment named '$NAME'"
    done
    run 3 alloc "$NAME" 16;    one_line_error "no segment named '$NAME'"
    run 3 free "$NAME" 0x1000; one_line_error "no segment named '$NAME'"
}

case_alloc_free() {
    run 0 create "$NAME" 20480
    run 0 alloc "$NAME" 100
    local block; block=$(cat "$OUT")
    expect "$OUT" '^0x[0-9a-f]+$'
    run 0 info "$NAME"
    check_field free $((20480 - 128)); check_field useFlock 1
    run 1 alloc "$NAME" 40000;        one_line_error "no free block of 40000 bytes"
    run 2 free "$NAME" 0x10;          one_line_error "is not a block of this segment's data area"
    run 0 free "$NAME" "$block"
    run 0 info "$NAME"
    check_field free 20480; check_field blocks 2
    run 6 free "$NAME" "$block";      one_line_error "the block at $block is free already"
}

case_read_only_commands_leave_segment_alone() {
    run 0 create "$NAME" 64k
    run 0 dump "$NAME"
    [ "$(wc -l <"$OUT")" = 27 ] || { echo "FAIL: dump printed $(wc -l <"$OUT") lines, expected 27"; FAILURES=$((FAILURES + 1)); }
    expect "$OUT" '^0x00000008 \[0\] = \{ \}$'
    expect "$OUT" '^0x00010000 \[13\] = \{ 0x[0-9a-f]+ \}$'
    expect "$OUT" '^0x20000000 \[26\] = \{ \}$'
    run 0 info "$NAME"
    check_field useFlock 0
    check_field free 65536
}

case_busy_segment() {
    run 0 create "$NAME" 8192
    "$POKE" busy "$NAME" 1 || { echo "FAIL: shm_poke"; exit 1; }
    run 4 info "$NAME";        one_line_error "segment '$NAME' is busy"
    check_field busy 1
    run 4 dump "$NAME";        one_line_error "segment '$NAME' is busy"
    run 4 alloc "$NAME" 16;    one_line_error "segment '$NAME' is busy"
    "$POKE" busy "$NAME" 0
    run 0 alloc "$NAME" 16
}

case_unpublished_segment() {
    # Unsized, and sized but never published (a creator that died): the tool
    # says so at once, and unlink removes them.
    for poke in empty "sized 12288"; do
        set -- $poke
        "$POKE" "$1" "$NAME" "${@:2}" || { echo "FAIL: shm_poke"; exit 1; }
        run 4 info "$NAME";    one_line_error "segment '$NAME' is not published yet.*qorbu-shm unlink $NAME"
        run 4 dump "$NAME";    one_line_error "is not published yet"
        run 4 alloc "$NAME" 8; one_line_error "is not published yet"
        run 0 unlink "$NAME"
        run 3 info "$NAME"
    done
    # An object no creator makes is damaged, not unpublished.
    "$POKE" sized "$NAME" 100
    for command in info dump "alloc 8" "free 0x1000"; do
        set -- $command
        run 1 "$1" "$NAME" "${@:2}"
        one_line_error "segment '$NAME' is damaged: an object of 100 bytes is no segment"
    done
    run 0 unlink "$NAME"
}

case_damaged_segment() {
    run 0 create "$NAME" 64k
    run 0 alloc "$NAME" 100
    local block; block=$(cat "$OUT")
    "$POKE" loop "$NAME" || { echo "FAIL: shm_poke"; exit 1; }
    for command in info dump "alloc 100" "free $block"; do
        set -- $command
        run 1 "$1" "$NAME" "${@:2}"
        one_line_error "segment '$NAME' has a damaged free list"
    done
    # A create that the library refuses leaves no object behind.
    run 0 unlink "$NAME"
    run 1 create "$NAME" 8k 0x1000;   one_line_error "cannot create segment '$NAME'"
    run 3 info "$NAME"
}

"case_$CASE"
if [ "$FAILURES" != 0 ]; then
    echo "$CASE: $FAILURES check(s) failed"
    exit 1
fi
echo "$CASE: all checks held"
