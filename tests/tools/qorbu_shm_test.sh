#!/bin/bash
# qorbu-shm as scripts drive it: exit codes and one-line errors, one case per
# behaviour; segments damaged through /dev/shm. Usage: $0 CASE WORD_BYTES [EMULATOR...] QORBU_SHM
set -u
CASE=$1 W=$2 TOOL=("${@:3}")
NAME=qorbu-shm-test-$CASE-$$ FAILURES=0 OUT=$(mktemp) ERR=$(mktemp)
SEG=/dev/shm/$NAME BUSY=$((W == 8 ? 60 : 36)) LISTS=$((W == 8 ? 64 : 40))
trap '"${TOOL[@]}" unlink "$NAME" >/dev/null 2>&1; rm -f "$OUT" "$ERR"' EXIT
fail() { echo "FAIL: $*"; sed 's/^/  | /' "$OUT" "$ERR"; FAILURES=$((FAILURES + 1)); }
# run STATUS ERROR_PATTERN ARGS...: the exit status, and stderr one matching line (or empty pattern)
run() {
    local expected=$1 pattern=$2; shift 2
    timeout 20 "${TOOL[@]}" "$@" >"$OUT" 2>"$ERR"; local status=$? # 124: it hung
    [ "$status" = "$expected" ] || fail "qorbu-shm $* exited $status, expected $expected"
    [ -z "$pattern" ] || { [ "$(wc -l <"$ERR")" = 1 ] && grep -Eq -- "^qorbu-shm: .*$pattern" "$ERR"; } ||
        fail "qorbu-shm $*: expected one error line matching /$pattern/"
}
expect() { grep -Eq -- "$1" "$OUT" || fail "expected /$1/ in the output"; }
word() { od -An -tu"$W" -j "$1" -N "$W" "$SEG" | tr -d ' '; }
poke() { perl -e 'open F, "+<", $ARGV[0] or die; seek F, $ARGV[1], 0; print F pack($ARGV[3] == 8 ? "Q<" : "V", $ARGV[2])' "$SEG" "$1" "$2" "$W"; }

case_bad_arguments() {
    run 2 "unknown command 'frob'" frob x
    for bad in "" a/b a:b; do run 2 "invalid segment name '$bad'" create "$bad" 4096; done
    for bad in 0 12x -5 5000000k 4096m; do run 2 "invalid size '$bad'" create "$NAME" "$bad"; done
    run 2 "invalid address '0x1001'" create "$NAME" 4096 0x1001
    run 3 "no segment named '$NAME'" info "$NAME"
}
case_lifecycle() {
    run 0 '' create "$NAME" 20k
    expect "^created $NAME: header 0x[0-9a-f]+, data 0x[0-9a-f]+, 24576 bytes in all, 20480 data bytes free$"
    local data=$(sed -E 's/.*data (0x[0-9a-f]+),.*/\1/' "$OUT")
    run 5 "segment '$NAME' exists already" create "$NAME" 4096
    run 0 '' dump "$NAME"
    [ "$(wc -l <"$OUT")" = 27 ] || fail "dump: not 27 lines"
    expect "^0x00004000 \[11\] = \{ $data \}$"
    run 0 '' alloc "$NAME" 100
    local block=$(cat "$OUT")
    run 0 '' info "$NAME"
    expect "^free +$((20480 - 128))$"; expect '^useFlock +1$'; expect '^busy +0$'
    run 1 'no free block of 40000 bytes' alloc "$NAME" 40000
    run 2 "is not a block of this segment's data area" free "$NAME" 0x10
    run 0 '' free "$NAME" "$block"
    run 6 "the block at $block is free already" free "$NAME" "$block"
    run 0 '' unlink "$NAME"
    for args in "info $NAME" "dump $NAME" "unlink $NAME" "alloc $NAME 8"; do run 3 "no segment named '$NAME'" $args; done
}
# Busy, or left half-made by a creator that died before sizing or publishing it.
case_unusable() {
    run 0 '' create "$NAME" 8k
    poke "$BUSY" 1
    for args in "info $NAME" "dump $NAME" "alloc $NAME 16"; do run 4 "segment '$NAME' is busy" $args; done
    poke "$BUSY" 0
    run 0 '' alloc "$NAME" 16
    for length in 0 12288; do
        run 0 '' unlink "$NAME"
        truncate -s "$length" "$SEG"
        for args in "info $NAME" "dump $NAME" "alloc $NAME 8"; do run 4 "'$NAME' is not published yet" $args; done
    done
    truncate -s 100 "$SEG" # no segment at all
    for args in "info $NAME" "free $NAME 0x1000"; do run 1 "an object of 100 bytes is no segment" $args; done
}
case_damaged() {
    run 0 '' create "$NAME" 64k
    run 0 '' alloc "$NAME" 100
    local block head; block=$(cat "$OUT") head=$(word $((LISTS + 12 * W)))
    poke $((head - $(word 0))) "$head" # the 32 KiB block links to itself
    for args in "info $NAME" "dump $NAME" "alloc $NAME 100" "free $NAME $block"; do
        run 1 "'$NAME' has a damaged free list" $args
    done
}
"case_$CASE"
[ "$FAILURES" = 0 ] || { echo "$CASE: $FAILURES check(s) failed"; exit 1; }
