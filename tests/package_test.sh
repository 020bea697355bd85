#!/usr/bin/env bash
# Builds the Debian package from a build tree, unpacks it into a scratch root, checks what it
# holds, then runs the packaged ekd on private directories and queries it with the packaged
# ekctl.
#
# Usage: package_test.sh CPACK BUILD_DIR SOURCE_DIR
set -euo pipefail

cpack=$1
build=$2
source=$3

scratch=$(mktemp -d "${TMPDIR:-/tmp}/ekora-package-XXXXXX")
ekd_pid=

cleanup() {
  if [[ -n $ekd_pid ]]; then
    kill -KILL "$ekd_pid" 2>/dev/null || true
    wait "$ekd_pid" 2>/dev/null || true
  fi
  rm -rf "$scratch"
}
trap cleanup EXIT
trap 'exit 130' INT
trap 'exit 143' TERM HUP

fail() {
  echo "package_test: FAILED: $*" >&2
  if [[ -s $scratch/ekd.log ]]; then
    echo "--- ekd log" >&2
    tail -n 50 "$scratch/ekd.log" >&2
  fi
  exit 1
}

[[ -f $build/CPackConfig.cmake ]] || fail "no CPackConfig.cmake in $build"

# --- Build the package -------------------------------------------------------------------
echo "building the package"
if ! timeout 45 "$cpack" -G DEB -B "$scratch/package" --config "$build/CPackConfig.cmake" \
  >"$scratch/cpack.log" 2>&1; then
  cat "$scratch/cpack.log" >&2
  fail "cpack did not build the package"
fi
shopt -s nullglob
debs=("$scratch"/package/*.deb)
shopt -u nullglob
[[ ${#debs[@]} -eq 1 ]] || fail "expected one .deb, found ${#debs[@]}"
deb=${debs[0]}
echo "built $(basename "$deb")"

[[ $(dpkg-deb -f "$deb" Package) == ekora ]] || fail "package name is not ekora"

# --- Contents ----------------------------------------------------------------------------
root=$scratch/root
dpkg-deb -x "$deb" "$root" || fail "dpkg-deb could not extract the package"

expected="./usr/bin/ek-sandbox-exec
./usr/bin/ekctl
./usr/bin/ekctl.entitlements
./usr/lib/systemd/system/ekd.service
./usr/lib/systemd/system/ekd.socket
./usr/lib/systemd/user/ekd.service
./usr/lib/systemd/user/ekd.socket
./usr/sbin/ekd
./usr/share/bash-completion/completions/ekctl
./usr/share/doc/ekora/changelog.gz
./usr/share/doc/ekora/copyright
./usr/share/lintian/overrides/ekora
./usr/share/man/man1/ek-sandbox-exec.1.gz
./usr/share/man/man1/ekctl.1.gz
./usr/share/man/man8/ekd.8.gz
./usr/share/zsh/vendor-completions/_ekctl"
actual=$(cd "$root" && find . ! -type d | LC_ALL=C sort)
if [[ $actual != "$expected" ]]; then
  diff <(echo "$expected") <(echo "$actual") >&2 || true
  fail "the package holds other files than the programs, units, manual pages and documents"
fi
# The installed ekctl is the administrator's: an entitlements file only root may change.
[[ $(stat -c %a "$root/usr/bin/ekctl.entitlements") == 644 ]] ||
  fail "ekctl.entitlements is not mode 0644"
grep -q com.corvane.private.ekora.manager "$root/usr/bin/ekctl.entitlements" ||
  fail "the installed ekctl lacks the manager entitlement"
grep -q '^SocketMode=0600$' "$root/usr/lib/systemd/system/ekd.socket" ||
  fail "the root instance's socket is not 0600"
grep -q '^ListenStream=%t/ekora/com.corvane.ekora.ekd$' "$root/usr/lib/systemd/user/ekd.socket" ||
  fail "the user socket is not \$XDG_RUNTIME_DIR/ekora/com.corvane.ekora.ekd"

# The maintainer scripts enable the root socket and every user's, and disable them again.
control=$scratch/control
dpkg-deb -e "$deb" "$control" || fail "dpkg-deb could not extract the control files"
for script in postinst prerm postrm; do
  [[ -x $control/$script ]] || fail "no executable $script"
  sh -n "$control/$script" || fail "$script is not valid sh"
done
grep -q 'deb-systemd-helper enable ekd.socket' "$control/postinst" ||
  fail "postinst does not enable ekd.socket"
grep -q 'deb-systemd-helper --user enable ekd.socket' "$control/postinst" ||
  fail "postinst does not enable the user socket"
grep -q 'deb-systemd-helper --user disable ekd.socket' "$control/postrm" ||
  fail "postrm does not disable the user socket"

# lintian frowns on running as root but checks the same.
if command -v lintian >/dev/null; then
  lintian --fail-on error,warning "$deb" >"$scratch/lintian.log" 2>&1 ||
    { cat "$scratch/lintian.log" >&2; fail "lintian finds fault with the package"; }
fi
for page in "$root"/usr/share/man/man*/*.gz; do
  warnings=$(gzip -dc "$page" | LC_ALL=C.UTF-8 groff -man -Tutf8 -ww -z 2>&1) ||
    fail "groff could not format $(basename "$page")"
  [[ -z $warnings ]] || fail "$(basename "$page") formats with warnings: $warnings"
done

# Every command and global option that ekctl offers has an entry in its manual page.
manual=$(gzip -dc "$root/usr/share/man/man1/ekctl.1.gz" | LC_ALL=C.UTF-8 groff -man -Tutf8 -P-cbou)
help=$(timeout 10 "$root/usr/bin/ekctl" --help) || fail "ekctl --help failed"
commands=$(awk '/^Subcommands:/ { listing = 1; next } listing && NF { print $1 }' <<<"$help")
[[ -n $commands ]] || fail "ekctl --help lists no commands"
for entry in $commands -S --json --timeout; do
  grep -qE -- "^ {7}${entry}( |$)" <<<"$manual" || fail "ekctl.1 does not document $entry"
done

# --- Run the packaged daemon ---------------------------------------------------------------
run=$scratch/run
state=$scratch/state
system=$scratch/System
mkdir -p "$run" "$state" "$system"
# A system plug-in and an extension point, so that discovery has something to find.
cp -R "$source/examples/System/Library" "$system/"
service=com.corvane.ekora.test.package.$$
export EKORA_RUNTIME_DIR=$run EKORA_STATE_DIR=$state EKORA_SYSTEM_ROOT=$system
unset JOURNAL_STREAM LISTEN_FDS LISTEN_PID LISTEN_FDNAMES EKORA_LOG

"$root/usr/sbin/ekd" -S "$service" </dev/null >/dev/null 2>"$scratch/ekd.log" &
ekd_pid=$!

ekctl() {
  timeout 15 "$root/usr/bin/ekctl" -S "$service" --timeout 10 "$@"
}

match_request='{"request":"match","version":3}'
reply=
for ((attempt = 0; attempt < 200; attempt++)); do
  kill -0 "$ekd_pid" 2>/dev/null || fail "ekd exited during start-up"
  if [[ -S $run/$service ]] && reply=$(ekctl raw "$match_request" 2>/dev/null); then
    break
  fi
  reply=
  sleep 0.1
done
[[ -n $reply ]] || fail "ekd did not answer within 20 s"
echo "raw match: $reply"
[[ $reply == *'"matches"'* ]] || fail "the raw match reply has no matches"
[[ $reply != *'"errorcode"'* ]] || fail "the raw match reply carries an error"
[[ $reply == *com.corvane.spellcheck* ]] || fail "the raw match reply lacks the system plug-in"
[[ -f $state/registry.db ]] || fail "ekd kept no registry in EKORA_STATE_DIR"

output=$(ekctl status -o json) || fail "ekctl status failed"
[[ $output == *"\"pid\": $ekd_pid,"* ]] || fail "ekctl status did not name the daemon: $output"
[[ $output == *'"plugins": 1,'* ]] || fail "ekctl status did not count the system plug-in: $output"

# Privileged discovery: granted to the installed ekctl, refused to a copy without its file.
ekctl match --flags 512 >/dev/null || fail "the installed ekctl was refused a privileged match"
cp "$root/usr/bin/ekctl" "$scratch/ekctl-plain"
status=0
timeout 15 "$scratch/ekctl-plain" -S "$service" --timeout 10 match --flags 512 >/dev/null \
  2>"$scratch/refused.err" || status=$?
[[ $status -eq 1 ]] || fail "an unauthorized match exited $status, expected 1"
grep -q '^ekctl: error 11: ' "$scratch/refused.err" || fail "no error line for the refused match"

# --- Stop it -----------------------------------------------------------------------------
kill -TERM "$ekd_pid"
status=0
wait "$ekd_pid" || status=$?
ekd_pid=
[[ $status -eq 0 ]] || fail "ekd exited with status $status after SIGTERM, expected 0"

echo "package_test: passed"
