#!/usr/bin/env bash
# Checks the systemd units with systemd's own tools: every unit verifies, and the system
# service's sandbox rates an exposure of 3.0 or better.
#
# Usage: units_test.sh SOURCE_DIR EKD
set -euo pipefail

source=$1
ekd=$2
skip=77
limit=3.0

if ! command -v systemd-analyze >/dev/null; then
  echo "units_test: SKIPPED: systemd-analyze is not installed"
  exit $skip
fi

scratch=$(mktemp -d "${TMPDIR:-/tmp}/ekora-units-XXXXXX")
trap 'rm -rf "$scratch"' EXIT
fail() {
  echo "units_test: FAILED: $*" >&2
  exit 1
}

# verify insists that ExecStart names an executable: point it at the ekd of this build.
mkdir -p "$scratch/system" "$scratch/user" "$scratch/runtime"
for unit in "$source"/systemd/ekd.* "$source"/systemd/user/ekd.*; do
  kind=system
  [[ $unit == */user/* ]] && kind=user
  sed "s#^ExecStart=/usr/sbin/ekd#ExecStart=$ekd#" "$unit" >"$scratch/$kind/$(basename "$unit")"
done

systemd-analyze verify --man=no "$scratch"/system/ekd.socket "$scratch"/system/ekd.service \
  >"$scratch/verify.log" 2>&1 || { cat "$scratch/verify.log" >&2; fail "system units"; }
[[ ! -s $scratch/verify.log ]] || { cat "$scratch/verify.log" >&2; fail "system units warn"; }
XDG_RUNTIME_DIR=$scratch/runtime systemd-analyze --user verify --man=no \
  "$scratch"/user/ekd.socket "$scratch"/user/ekd.service >"$scratch/verify.log" 2>&1 ||
  { cat "$scratch/verify.log" >&2; fail "user units"; }
[[ ! -s $scratch/verify.log ]] || { cat "$scratch/verify.log" >&2; fail "user units warn"; }

grep -q '^SocketMode=0600$' "$scratch/system/ekd.socket" || fail "the system socket is not 0600"
for service in "$scratch"/system/ekd.service "$scratch"/user/ekd.service; do
  grep -q '^LimitNOFILE=' "$service" || fail "$service sets no LimitNOFILE"
done

rating=$(systemd-analyze security --offline=true --no-pager "$scratch/system/ekd.service" 2>&1 |
  sed -n 's/.*Overall exposure level for ekd.service: \([0-9.]*\).*/\1/p')
[[ -n $rating ]] || fail "systemd-analyze security gave no rating"
echo "system service exposure: $rating (at most $limit)"
awk -v r="$rating" -v l="$limit" 'BEGIN { exit !(r <= l) }' || fail "exposure $rating > $limit"

echo "units_test: passed"
