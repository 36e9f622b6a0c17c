#!/bin/sh
# Builds the shared-memory allocator's libFuzzer target with clang
# (AddressSanitizer) in build/fuzz and runs it briefly. Exits non-zero when
# the fuzzer finds a fault. FUZZ_SECONDS overrides the run time (30 s).
set -eu
root=$(cd "$(dirname "$0")/.." && pwd)
out="$root/build/fuzz"
seconds=${FUZZ_SECONDS:-30}
CXX=${CXX_FUZZ:-clang++}

fuzzer_runtime_present() {
    command -v "$CXX" >/dev/null 2>&1 || return 1
    dir=$("$CXX" -print-resource-dir 2>/dev/null) || return 1
    ls "$dir"/lib/linux/libclang_rt.fuzzer-*.a >/dev/null 2>&1
}

if ! fuzzer_runtime_present; then
    echo "fuzz-shm: installing clang and its libFuzzer runtime"
    export DEBIAN_FRONTEND=noninteractive
    apt-get update -qq
    apt-get install -y -qq clang libclang-rt-dev >/dev/null
fi

mkdir -p "$out/corpus"
"$CXX" -std=c++20 -g -O1 -fsanitize=fuzzer,address,undefined -fno-sanitize-recover=all \
    -I"$root" -I"$root/tests" \
    "$root"/shm/*.cpp "$root/tests/fuzz/shm_fuzz.cpp" -o "$out/shm_fuzz"

# Each run starts from the corpus that earlier runs left in build/fuzz.
cd "$out"
exec ./shm_fuzz -max_total_time="$seconds" -timeout=20 -rss_limit_mb=2048 -print_final_stats=1 corpus
