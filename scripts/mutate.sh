#!/usr/bin/env bash
# Mutation run over the six service folders: a seeded sample of mutants
# (flipped comparisons, constants off by one, dropped calls, swapped error and
# wait codes, locks dropped or moved), each applied in turn, built in its own
# tree and put to the host test suite. A tool to run by hand, not part of CI.
#
#   scripts/mutate.sh [--seed N] [--count N] [--list] [--only I,J,...] [--timeout S] [--build DIR]
#
# Prints "killed|survived file:line kind: original -> mutated" per mutant
# (killed ones name the first failing test), then the score. A mutant that
# does not compile is stillborn: not counted, the next one in the list is
# taken instead. --only runs just the mutants of those numbers of --list (to
# check survivors again). The source is restored after each mutant and on any
# exit. The benchmark's short mode is no test here and is left out.
set -uo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
seed=14
count=60
timeout=20
build="$root/build/mutate"
list=0
only=""
while [[ $# -gt 0 ]]; do
  case "$1" in
    --seed) seed=$2; shift 2 ;;
    --count) count=$2; shift 2 ;;
    --timeout) timeout=$2; shift 2 ;;
    --build) build=$2; shift 2 ;;
    --list) list=1; shift ;;
    --only) only=",$2,"; shift 2 ;;
    -h|--help) sed -n '2,15p' "$0" | sed 's/^# \{0,1\}//'; exit 0 ;;
    *) echo "mutate.sh: unknown option $1" >&2; exit 2 ;;
  esac
done

gen=(python3 "$root/scripts/mutants.py")
if [[ $list -eq 1 ]]; then
  # The first COUNT are the sample; the rest replace stillborn ones in order.
  "${gen[@]}" list --seed "$seed" --limit $((count * 3 / 2))
  exit 0
fi

# One mutated file at a time; the trap puts it back whatever ends the run.
work=$(mktemp -d)
current=""
restore() {
  if [[ -n $current ]]; then
    cp "$work/original" "$root/$current"
    current=""
  fi
}
on_exit() { restore; rm -rf "$work"; }
trap on_exit EXIT
trap 'exit 130' INT TERM HUP

if ! git -C "$root" diff --quiet -- src; then
  echo "mutate.sh: src/ has uncommitted changes; commit or stash them first" >&2
  exit 2
fi

nice_run() { nice -n 10 "$@"; }

# Like host-debug, but without debug info or -Werror (a mutant may leave an
# unused variable), linked with lld, and with a short per-test time-out.
if [[ ! -f $build/CMakeCache.txt ]]; then
  nice_run cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Debug \
    -DCMAKE_C_FLAGS_DEBUG=-O0 -DCMAKE_CXX_FLAGS_DEBUG=-O0 \
    -DCMAKE_EXE_LINKER_FLAGS=-fuse-ld=lld -DSKYVANE_WERROR=OFF \
    -DSKYVANE_TEST_TIMEOUT="$timeout" >/dev/null || exit 2
fi
# Only the programs that contain the service code (they link skyvane_core)
# change with a mutant; the benchmark is left out. Incremental: the mutated
# file, the one restored before it, and the links.
mapfile -t programs < <(ninja -C "$build" -t query libskyvane_core.a 2>/dev/null |
  sed -n '/outputs:/,$p' | tail -n +2 | sed 's/^ *//' | sort -u |
  grep -vE '(^all$|^skyvane_core$|\.a$|skyvane_bench)')
if [[ ${#programs[@]} -eq 0 ]]; then
  echo "mutate.sh: no program links skyvane_core in $build" >&2
  exit 2
fi
build_tree() { nice_run cmake --build "$build" -j2 --target "${programs[@]##*/}" >"$work/build.log" 2>&1; }

# The tests that run one of those programs: a test of the emulation or the
# simulator alone cannot tell a mutant from the original, so it is skipped.
select_tests() {
  (cd "$build" && ctest --show-only=json-v1 2>/dev/null) | python3 -c '
import json, re, sys
programs = sys.argv[1:]
skipped = [t["name"] for t in json.load(sys.stdin)["tests"]
           if not any(a.endswith("/" + p) or a == p for a in t.get("command", []) for p in programs)]
print("|".join(["^bench"] + ["^" + re.escape(n) + "$" for n in skipped]))' "${programs[@]}"
}

# Runs the suite; prints the first failing test, or nothing if all passed.
run_suite() {
  (cd "$build" && nice_run timeout -k 5 $((timeout * 6)) \
    ctest -j2 --stop-on-failure --timeout "$timeout" -E "$skip" >"$work/test.log" 2>&1)
  local rc=$?
  if [[ $rc -eq 0 ]]; then return 0; fi
  local first
  first=$(grep -m1 -E '\*\*\*(Failed|Timeout|Exception|Not Run)' "$work/test.log" |
    sed -E 's/.*Test +#[0-9]+: ([^ ]+).*/\1/')
  [[ $rc -eq 124 || $rc -eq 137 ]] && first="${first:-suite} (run timed out)"
  echo "${first:-ctest exit $rc}"
  return 1
}

echo "mutate: seed $seed, $count mutants, build $build, per-test time-out ${timeout}s"
if ! nice_run cmake --build "$build" -j2 >"$work/build.log" 2>&1; then
  echo "mutate.sh: the unmutated tree does not build, see $work/build.log" >&2
  cat "$work/build.log" >&2
  exit 2
fi
skip=$(select_tests)
if failed=$(run_suite); then :; else
  echo "mutate.sh: the unmutated suite fails ($failed); fix that first" >&2
  exit 2
fi

total=$("${gen[@]}" count --seed "$seed")
killed=0
survived=0
stillborn=0
index=0
start=$(date +%s)
while [[ $((killed + survived)) -lt $count && $index -lt $total ]]; do
  if [[ -n $only && $only != *",$index,"* ]]; then
    index=$((index + 1))
    [[ $index -gt $(echo "$only" | tr ',' '\n' | sort -n | tail -n1) ]] && break
    continue
  fi
  line=$("${gen[@]}" list --seed "$seed" --limit $((index + 1)) | tail -n1 | cut -f2-)
  file=${line%%:*}
  cp "$root/$file" "$work/original"
  current=$file
  if ! "${gen[@]}" apply --seed "$seed" --index "$index" >/dev/null; then
    restore
    index=$((index + 1))
    continue
  fi
  index=$((index + 1))
  t0=$(date +%s)
  if ! build_tree; then
    restore
    stillborn=$((stillborn + 1))
    continue
  fi
  if failed=$(run_suite); then
    survived=$((survived + 1))
    verdict="survived"
    failed=""
  else
    killed=$((killed + 1))
    verdict="killed"
    failed=" [$failed]"
  fi
  restore
  echo "$verdict $line$failed (#$((index - 1)), $(($(date +%s) - t0))s)"
done

# Put the build back in step with the restored source.
build_tree || true
elapsed=$(($(date +%s) - start))
done_count=$((killed + survived))
if [[ $done_count -eq 0 ]]; then
  echo "score: no mutant ran"
  exit 1
fi
echo "score: $killed/$done_count killed ($((100 * killed / done_count))%), $survived survived," \
  "$stillborn stillborn, $((elapsed / done_count))s per mutant"
