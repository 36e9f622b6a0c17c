#!/usr/bin/env bash
# The whole test suite on a fresh Debian 12 machine: installs what it needs,
# checks that every C and C++ file is formatted as .clang-format says, then
# builds and runs ctest for x86_64, i386 (qemu), armhf (qemu) and the
# address/undefined-behaviour sanitizers, and fuzzes the allocator and the
# timer heap briefly (preset fuzz: clang, each fuzzer run for 20 s as a ctest).
set -uo pipefail
cd "$(dirname "$0")/.."
source scripts/require-packages.sh

require_packages cmake ninja-build g++ gcc googletest valgrind pkg-config \
    g++-arm-linux-gnueabihf g++-i686-linux-gnu qemu-user \
    libsnmp-dev snmp clang clang-format libclang-rt-14-dev dpkg-dev file lintian || exit 1

jobs=$(nproc)
failed=()

echo "=== style ==="
if git ls-files -z '*.c' '*.h' '*.cpp' | xargs -0 clang-format --dry-run --Werror; then
    echo "=== style: passed ==="
else
    failed+=(style)
fi

for preset in default i386 armhf asan fuzz; do
    echo "=== $preset ==="
    if cmake --preset "$preset" >/dev/null &&
        cmake --build --preset "$preset" -j"$jobs" &&
        ctest --preset "$preset"; then
        echo "=== $preset: passed ==="
    else
        failed+=("$preset")
    fi
done

if ((${#failed[@]})); then
    echo "FAILED: ${failed[*]}"
    exit 1
fi
echo "all test suites passed"
