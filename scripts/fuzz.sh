#!/usr/bin/env bash
# Runs the fuzz targets of the host build for a chosen time each, from the
# checked-in seeds, and prints for each the runs, the coverage and what it
# found. What a run finds new stays in build/fuzz-corpus/NAME; a crash is
# written to build/fuzz-findings/NAME/.
#
#   scripts/fuzz.sh [-t SECONDS | -c CPU_SECONDS] [-j JOBS] [NAME...]
#
# NAME is a target's corpus name (tests/fuzz/NAME_fuzz.cpp); none means all.
# -t is the (wall) time per target (default 600); -c instead runs each target
# until it has had that many seconds of CPU, however loaded the machine is;
# -j how many run at once (default 1); the table gives the CPU seconds each
# run had.
# The runs are niced. The exit status is 1 when any target found something.
set -euo pipefail
cd "$(dirname "$0")/.."

seconds=600
cpu=0
jobs=1
while getopts "t:c:j:" option; do
  case $option in
    t) seconds=$OPTARG ;;
    c) cpu=$OPTARG seconds=$((OPTARG * 50)) ;;
    j) jobs=$OPTARG ;;
    *) sed -n '2,14p' "$0"; exit 2 ;;
  esac
done
shift $((OPTIND - 1))

build=build
names=("$@")
if [ ${#names[@]} -eq 0 ]; then
  for source in tests/fuzz/*_fuzz.cpp; do
    name=$(basename "$source" .cpp)
    names+=("${name%_fuzz}")
  done
fi
targets=()
for name in "${names[@]}"; do
  targets+=("fuzz_${name}_fuzz")
done
cmake --build --preset host --target "${targets[@]}" >/dev/null

mkdir -p "$build/fuzz-logs"
run() {
  local name=$1
  local work="$build/fuzz-corpus/$name" findings="$build/fuzz-findings/$name/"
  mkdir -p "$work" "$findings"
  local seeds=()
  [ -d "tests/fuzz/corpus/$name" ] && seeds=("tests/fuzz/corpus/$name")
  nice "$build/fuzz_${name}_fuzz" -max_total_time="$seconds" -timeout=10 -rss_limit_mb=4096 \
    -print_final_stats=1 -artifact_prefix="$findings" "$work" "${seeds[@]}" \
    >"$build/fuzz-logs/$name.log" 2>&1 &
  local pid=$! used=0 ticks
  ticks=$(getconf CLK_TCK)
  # The CPU seconds the run has had, user and system together; with a CPU
  # budget the run is interrupted (it prints its statistics) once it is spent.
  while kill -0 "$pid" 2>/dev/null; do
    used=$(awk -v t="$ticks" '{ print int(($14 + $15) / t) }' "/proc/$pid/stat" 2>/dev/null || echo "$used")
    [ "$cpu" -gt 0 ] && [ "$used" -ge "$cpu" ] && kill -INT "$pid"
    sleep 2
  done
  wait "$pid" || true
  echo "$used" >"$build/fuzz-logs/$name.cpu"
}
export -f run
export build seconds cpu

printf '%s\n' "${names[@]}" | xargs -P "$jobs" -I{} bash -c 'run {}'

status=0
printf '%-14s %10s %8s %8s %8s %s\n' target runs cov ft "cpu s" findings
for name in "${names[@]}"; do
  log="$build/fuzz-logs/$name.log"
  runs=$(grep -o 'stat::number_of_executed_units: *[0-9]*' "$log" | grep -o '[0-9]*$' || echo "?")
  last=$(grep -E '^#[0-9]+' "$log" | tail -1)
  cov=$(echo "$last" | grep -o 'cov: [0-9]*' | grep -o '[0-9]*' || echo "?")
  ft=$(echo "$last" | grep -o 'ft: [0-9]*' | grep -o '[0-9]*' || echo "?")
  found=$(ls "$build/fuzz-findings/$name" 2>/dev/null | wc -l)
  [ "$found" -ne 0 ] && status=1
  printf '%-14s %10s %8s %8s %8s %s\n' "$name" "$runs" "$cov" "$ft" "$(cat "$build/fuzz-logs/$name.cpu")" "$found"
done
exit $status
