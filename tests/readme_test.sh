#!/usr/bin/env bash
# tests/readme_test.sh SOURCE_DIR BUILD_DIR: runs each shell block of README.md as a reader
# would type it, with the programs of BUILD_DIR standing in for build/demo. A block that needs a
# running service manager is only checked for the units it names when none runs here.
set -euo pipefail
src=$1
build=$2
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
fail() {
  echo "FAIL: $*" >&2
  exit 1
}

awk -v dir="$work" '/^```sh$/ { n++; inside = 1; next } /^```$/ { inside = 0; next }
  inside { print > sprintf("%s/block-%02d.sh", dir, n) }' "$src/README.md"
blocks=("$work"/block-*.sh)
[ "${#blocks[@]}" -ge 4 ] || fail "README.md has ${#blocks[@]} shell blocks, expected 4 or more"

# The two commands: the demo against this build; scripts/test is the command running this.
run_commands() {
  grep -q '^scripts/test' "$1" || fail "the first block no longer names scripts/test"
  grep -q '^scripts/demo' "$1" || fail "the first block no longer names scripts/demo"
  local out=$work/demo.out
  (cd "$src" && EKORA_DEMO_BUILD=$build scripts/demo >"$out" 2>&1) ||
    { cat "$out"; fail "scripts/demo failed"; }
  for expected in '(removed)' 'ekd stopped by SIGTERM with exit status 0'; do
    grep -qF "$expected" "$out" || { cat "$out"; fail "scripts/demo did not print '$expected'"; }
  done
  echo "scripts/demo ran to its end"
}

# Deployment blocks: enable a socket unit of this tree (system or user).
run_deployment() {
  local unit_dir=$src/systemd
  grep -q -- '--user' "$1" && unit_dir=$src/systemd/user
  for unit in $(grep -o '[a-z-]*\.socket' "$1"); do
    [ -f "$unit_dir/$unit" ] || fail "$(basename "$1") enables $unit, which $unit_dir lacks"
  done
  echo "$(basename "$1"): not run, it needs a service manager with the package installed"
}

# Running it by hand, from a directory shaped like a checkout after scripts/demo.
run_by_hand() {
  local tree=$work/tree out=$work/by-hand.out
  mkdir -p "$tree/build"
  ln -s "$build" "$tree/build/demo"
  ln -s "$src/examples" "$tree/examples"
  (cd "$tree" && bash -eu -c "$(cat "$1")"$'\nwait %1' >"$out" 2>&1) ||
    { cat "$out"; fail "$(basename "$1") failed (ekd's exit status is that of the block)"; }
  grep -q '"matches"' "$out" || { cat "$out"; fail "ekctl raw did not print the matches"; }
  echo "$(basename "$1"): ekd answered and stopped cleanly"
}

for block in "${blocks[@]}"; do
  if grep -q 'scripts/demo' "$block"; then
    run_commands "$block"
  elif grep -q 'systemctl' "$block"; then
    run_deployment "$block"
  elif grep -q 'build/demo/' "$block"; then
    run_by_hand "$block"
  else
    fail "$(basename "$block") is of no kind this test knows how to run"
  fi
done
