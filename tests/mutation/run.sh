#!/usr/bin/env bash
# Plants each fault of the lists (tests/mutation/*.txt) in turn, builds the unit tests, runs them
# and says whether they caught it; the file is put back after each.
#
#   tests/mutation/run.sh [-b BUILD_DIR] [NAME...]
#
# BUILD_DIR is a configured host build (default: build). NAME picks
# mutations by name, or a whole list by its file's name (config, load, ...);
# none means all. Per mutation: "caught" (a test failed),
# "MISSED" (all passed), "no build" (the fault does not compile: fix the
# list). The exit status is 1 when any was missed. A list whose first line
# reads "# target: TARGET PATH" is run with that test program (built as
# TARGET, at BUILD_DIR/PATH) in place of the unit tests.
set -euo pipefail
cd "$(dirname "$0")/../.."

build=build
while getopts "b:" option; do
  case $option in
    b) build=$OPTARG ;;
    *) sed -n '2,11p' "$0"; exit 2 ;;
  esac
done
shift $((OPTIND - 1))

saved=$(mktemp -d)
current=""
restore() {
  if [ -n "$current" ]; then
    cp "$saved/original" "$current"
    current=""
  fi
}
trap 'restore; rm -rf "$saved"' EXIT

# Applies one mutation: the file's text replaced once, or exit 3 when the
# text is not there exactly once.
apply() {
  python3 - "$1" "$2" "$3" <<'PY'
import sys
path, old, new = sys.argv[1], sys.argv[2].replace("<NL>", "\n"), sys.argv[3].replace("<NL>", "\n")
text = open(path).read()
if text.count(old) != 1:
    sys.exit(3)
open(path, "w").write(text.replace(old, new))
PY
}

# Whether the first argument is among the others.
picked() {
  local wanted=$1 each
  shift
  for each in "$@"; do
    [ "$each" = "$wanted" ] && return 0
  done
  return 1
}

caught=0 missed=0 broken=0 total=0
declare -A built=()
missedNames=()
while IFS=: read -r path line; do
  group=$(basename "$path" .txt)
  case "$line" in '#'* | '') continue ;; esac
  name=${line%% ||| *}
  rest=${line#* ||| }
  file=${rest%% ||| *}
  rest=${rest#* ||| }
  text=${rest%% ||| *}
  replacement=${rest#* ||| }
  if [ $# -gt 0 ] && ! picked "$name" "$@" && ! picked "$group" "$@"; then
    continue
  fi
  total=$((total + 1))
  target= binary=
  read -r target binary < <(sed -n '1s/^# target: //p' "$path") || true
  built[${target:-unit_tests}]=1
  target=${target:-unit_tests} binary=${binary:-unit_tests}
  cp "$file" "$saved/original"
  current=$file
  if ! apply "$file" "$text" "$replacement"; then
    restore
    printf '%-28s %s\n' "$name" "text not found once"
    broken=$((broken + 1))
    continue
  fi
  if ! nice cmake --build "$build" --target "$target" >"$saved/build.log" 2>&1; then
    result="no build"
    broken=$((broken + 1))
  elif timeout 240 nice "$build/$binary" --gtest_brief=1 --gtest_fail_fast >"$saved/test.log" 2>&1; then
    result="MISSED"
    missed=$((missed + 1))
    missedNames+=("$name")
  else
    result="caught"
    caught=$((caught + 1))
  fi
  restore
  printf '%-28s %s\n' "$name" "$result"
done < <(grep -H '' tests/mutation/*.txt)

# The build left as the sources are.
for target in "${!built[@]}"; do
  nice cmake --build "$build" --target "$target" >/dev/null 2>&1 || true
done
echo "mutations: $total, caught: $caught, missed: $missed, not built: $broken"
[ ${#missedNames[@]} -eq 0 ] || echo "missed: ${missedNames[*]}"
[ "$missed" -eq 0 ]
