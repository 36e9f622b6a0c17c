#!/usr/bin/env bash
# The demo on a fresh Debian 12 machine: installs what it needs (apt-get,
# only what is missing), builds the default preset and runs
#   qorbu-demo --self-test
# which starts the demo host daemon with client green threads, queries its
# SNMP agent with snmpget, reads its shared segment from a second process,
# prints a summary and exits 0 only when every check held.
#
#   bash scripts/demo.sh                 8 clients
#   bash scripts/demo.sh --clients 100   any qorbu-demo option is passed on
set -uo pipefail
cd "$(dirname "$0")/.."
source scripts/require-packages.sh

require_packages cmake ninja-build g++ gcc pkg-config googletest libsnmp-dev snmp || exit 1

cmake --preset default >/dev/null || exit 1
cmake --build --preset default -j"$(nproc)" --target qorbu-demo qorbu-shm 2>&1 | tail -3
demo=build/default/examples/qorbu-demo
if [ ! -x "$demo" ]; then
    echo "demo.sh: qorbu-demo was not built:" >&2
    cmake --preset default 2>&1 | grep -E 'qorbu-(demo|shm):' >&2
    exit 1
fi
echo "=== $demo --self-test${*:+ $*} ==="
exec "$demo" --self-test "$@"
