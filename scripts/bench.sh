#!/usr/bin/env bash
# Builds the peer comparisons (bench/) in a Release tree (build/bench), runs
# them and writes BENCHMARKS.md: each section's prose from bench/text/, the
# drivers' tables, and plots drawn with bench/figure.gp into docs/bench/.
# Never part of ctest.
#
#   bash scripts/bench.sh            full run (about 5-8 minutes on 2 cores)
#   bash scripts/bench.sh --quick    smoke run: fewer repetitions, smaller sizes;
#                                    writes to build/bench/results only
#
# Needs cmake, ninja and g++; installs what else is missing with apt-get:
# gnuplot-nox and the peers libevent-dev libev-dev libuv1-dev libboost-dev
# libboost-context-dev.
set -euo pipefail

root=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
build=${QORBU_BENCH_BUILD:-$root/build/bench}
results=$build/results
quick=0
[[ ${1:-} == --quick ]] && quick=1

missing=()
for pkg in libevent-dev libev-dev libuv1-dev libboost-dev libboost-context-dev gnuplot-nox; do
  dpkg-query -W -f='${Status}' "$pkg" 2>/dev/null | grep -q 'ok installed' || missing+=("$pkg")
done
if ((${#missing[@]})); then
  echo "bench.sh: installing ${missing[*]}" >&2
  apt-get install -y -q "${missing[@]}" >/dev/null || {
    echo "bench.sh: cannot install ${missing[*]} (run apt-get update, or install them as root)" >&2
    exit 1
  }
fi

start=$(date +%s)
load=$(cut -d' ' -f1-3 /proc/loadavg)
cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release \
  -DQORBU_BUILD_TESTS=OFF -DQORBU_BUILD_EXAMPLES=OFF >/dev/null
# A driver whose library part is missing or broken is reported and skipped.
drivers=()
for p in switch shm dispatch timers; do
  if cmake --build "$build" -j2 --target "peer_$p"; then
    drivers+=("$p")
  else
    echo "bench.sh: peer_$p did not build; its figures are left out" >&2
  fi
done
((${#drivers[@]})) || { echo "bench.sh: nothing was built" >&2; exit 1; }

rm -rf "$results"
mkdir -p "$results"
if ((quick)); then
  args=(--reps=3 --scale=0.1 "--out=$results")
else
  args=(--reps=7 --sample-ms=15 "--out=$results")
fi
for p in "${drivers[@]}"; do
  echo "== peer_$p" >&2
  "$build/bench/peer_$p" "${args[@]}"
done
sections=(timers_arm_cancel timers_rearm timers_fire dispatch_select dispatch_epoll switching
          shm_one_process shm_two_processes)
title() { sed -n '1s/^### //p' "$root/bench/text/$1.md"; }
for s in "${sections[@]}"; do
  [[ -f "$results/$s.vars" ]] || continue
  (cd "$results" && gnuplot -e "id='$s'; title='$(title "$s")'" "$root/bench/figure.gp")
done

if ((quick)); then
  echo "quick run: results in $results (BENCHMARKS.md not rewritten)" >&2
  exit 0
fi

mkdir -p "$root/docs/bench"
rm -f "$root/docs/bench"/*.png
cp "$results"/*.png "$root/docs/bench/"

peer_versions=$(dpkg-query -W -f='${Package} ${Version}\n' libevent-dev libev-dev libuv1-dev libboost-dev \
  libboost-context-dev libc6 2>/dev/null | sed 's/^/    /')
{
  cat <<EOF
# Benchmarks: libqorbu against its peers

Every figure below was measured in one run of \`bash scripts/bench.sh\` (Release build in
\`build/bench\`). Within a figure the contenders run in the same process, interleaved: each of the
7 repetitions runs every contender once, starting with a different one each time, and the table
shows the median. Each cell is the median cost of one operation in nanoseconds and, in brackets,
its ratio to the best peer of that row (below 1.00x: faster than every peer). The floors are not
peers: they show what the system calls or the C library alone cost. Samples are timed on the
thread's CPU-time clock, so time spent descheduled by other load on the machine is not counted;
the two-process figures are wall-clock, since waiting for the other process is part of them.

Sources: \`bench/\` (one driver per workload, \`harness.h\` for the interleaving, medians and
tables, \`figure.gp\` for the plots, \`text/\` for the prose of each section).

## How to rerun

    bash scripts/bench.sh           # builds build/bench (Release), runs everything, rewrites this file
    bash scripts/bench.sh --quick   # smoke run, results in build/bench/results only
    build/bench/bench/peer_timers --reps=7 --out=/tmp/x   # one driver alone

The run took $(( $(date +%s) - start )) s on the machine below. Figures on a shared or loaded
machine move by 10-20 % from run to run; ratios within one row move much less.

## Machine

    $(nproc) CPUs online (nproc); $(uname -srmo); load average at the start: $load
$(lscpu | grep -E '^(Model name|Architecture|CPU\(s\)|Thread|Core|Socket|CPU max MHz|L1d|L2|L3|Hypervisor)' | sed 's/^/    /')
    compiler: $(c++ --version | head -1)
    peers (Debian packages):
$peer_versions
    commit: $(git -C "$root" rev-parse --short HEAD 2>/dev/null || echo unknown), $(date -u '+%Y-%m-%d %H:%M UTC')

## Results

EOF
  for s in "${sections[@]}"; do
    cat "$root/bench/text/$s.md"
    echo
    if [[ -f "$results/$s.md" ]]; then
      cat "$results/$s.md"
      printf '\n![%s](docs/bench/%s.png)\n\n' "$(title "$s")" "$s"
    else
      printf 'Not measured in this run: its driver did not build.\n\n'
    fi
  done
  cat "$root/docs/bench/analysis.md"
} >"$root/BENCHMARKS.md"
echo "wrote $root/BENCHMARKS.md in $(( $(date +%s) - start )) s" >&2
