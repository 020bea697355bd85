#!/usr/bin/env bash
# Runs ekd as an ordinary user the way that user's service manager does (socket activation on
# $XDG_RUNTIME_DIR/ekora/com.corvane.ekora.ekd) and reaches it with that user's ekctl without
# options: ekctl must find the socket there, or in /tmp/ekora-<uid> without XDG_RUNTIME_DIR.
#
# Usage: user_instance_test.sh EKD EKCTL SOURCE_DIR
set -euo pipefail

ekd=$1
ekctl=$2
source=$3
uid=65534
gid=65534
skip=77

if [[ $(id -u) -ne 0 ]]; then
  echo "user_instance_test: SKIPPED: running ekd as another user needs root"
  exit $skip
fi
for tool in setpriv systemd-socket-activate timeout; do
  if ! command -v "$tool" >/dev/null; then
    echo "user_instance_test: SKIPPED: $tool is not installed"
    exit $skip
  fi
done

scratch=$(mktemp -d "${TMPDIR:-/tmp}/ekora-user-XXXXXX")
activator_pid=
fallback_made=
cleanup() {
  if [[ -n $activator_pid ]]; then
    kill -KILL "$activator_pid" 2>/dev/null || true
    wait "$activator_pid" 2>/dev/null || true
  fi
  [[ -n $fallback_made ]] && rm -rf "$fallback_made"
  rm -rf "$scratch"
}
trap cleanup EXIT
trap 'exit 130' INT
trap 'exit 143' TERM HUP

fail() {
  echo "user_instance_test: FAILED: $*" >&2
  if [[ -s $scratch/ekd.log ]]; then
    echo "--- ekd log" >&2
    tail -n 30 "$scratch/ekd.log" >&2
  fi
  exit 1
}

# The user's own copies: the build tree need not be readable by that user.
chmod 0755 "$scratch"
install -m 0755 "$ekd" "$scratch/ekd"
install -m 0755 "$ekctl" "$scratch/ekctl"
cp -R "$source/examples/System" "$scratch/System"
chmod -R a+rX "$scratch/System"
home=$scratch/home
install -d -o "$uid" -g "$gid" -m 0700 "$home" "$scratch/xdg-run"

# The command that runs what follows as the user, with only what a login session would set
# (each program execs the next, so a process started with it keeps its pid).
user_command() {
  local runtime=$1
  as_user=(setpriv --reuid="$uid" --regid="$gid" --clear-groups env -i HOME="$home"
    XDG_STATE_HOME="$home/.local/state" PATH=/usr/sbin:/usr/bin:/sbin:/bin
    EKORA_SYSTEM_ROOT="$scratch/System")
  [[ -z $runtime ]] || as_user+=(XDG_RUNTIME_DIR="$runtime")
}

# One case per way a client finds the socket: XDG_RUNTIME_DIR given, or not.
run_case() {
  local runtime=$1 directory=$2
  local socket=$directory/com.corvane.ekora.ekd
  user_command "$runtime"
  # The user manager makes the socket's directory (DirectoryMode=0700) before listening.
  "${as_user[@]}" mkdir -p -m 0700 "$directory"
  : >"$scratch/ekd.log"
  # systemd-socket-activate hands on only the variables it is told to, as a unit would.
  local passed=(-E HOME -E XDG_STATE_HOME -E EKORA_SYSTEM_ROOT)
  [[ -n $runtime ]] && passed+=(-E XDG_RUNTIME_DIR)
  "${as_user[@]}" systemd-socket-activate "${passed[@]}" -l "$socket" "$scratch/ekd" \
    </dev/null >/dev/null 2>"$scratch/ekd.log" &
  activator_pid=$!

  local reply= attempt
  for ((attempt = 0; attempt < 200; attempt++)); do
    kill -0 "$activator_pid" 2>/dev/null || fail "systemd-socket-activate exited early"
    if [[ -S $socket ]]; then
      reply=$("${as_user[@]}" timeout 15 "$scratch/ekctl" --json match 2>"$scratch/ekctl.err") && break
      reply=
    fi
    sleep 0.1
  done
  [[ -n $reply ]] || fail "ekctl (no options) got no reply on $socket: $(cat "$scratch/ekctl.err")"
  # The system volume is registered once the daemon serves.
  for ((attempt = 0; attempt < 200; attempt++)); do
    "${as_user[@]}" "$scratch/ekctl" status -o json | grep -q '"scanning": false' && break
    sleep 0.1
  done
  reply=$("${as_user[@]}" timeout 15 "$scratch/ekctl" --json match)
  [[ $reply == *com.corvane.spellcheck* ]] ||
    fail "the user's ekd did not register the system plug-in: $reply"
  [[ $(stat -c %u "$socket") == "$uid" ]] || fail "$socket is not owned by uid $uid"
  local registry=$home/.local/state/ekora/registry.db
  [[ -f $registry && $(stat -c %u "$registry") == "$uid" ]] ||
    fail "no registry of the user's own in $registry"
  grep -q "listening on $socket (socket-activated)" "$scratch/ekd.log" ||
    fail "no start line naming $socket"

  kill -TERM "$activator_pid"
  local status=0
  wait "$activator_pid" || status=$?
  activator_pid=
  [[ $status -eq 0 ]] || fail "ekd exited with status $status after SIGTERM"
  echo "reached uid $uid's ekd on $socket"
}

run_case "$scratch/xdg-run" "$scratch/xdg-run/ekora"

fallback=/tmp/ekora-$uid
if [[ -e $fallback ]]; then
  echo "not trying the fallback: $fallback exists already"
elif [[ $(stat -c %a /tmp) != 1777 ]]; then
  echo "not trying the fallback: /tmp is mode $(stat -c %a /tmp), not 1777, so no user may use it"
else
  fallback_made=$fallback
  run_case "" "$fallback"
fi

echo "user_instance_test: passed"
