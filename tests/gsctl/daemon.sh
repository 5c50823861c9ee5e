# Sourced by the scripts beside it, with the folder of the programs as $1: a folder that goes away again, with a gsd of
# its own; ends all that the script has started, however it ends.

# The leak checker guesses where the thread-local memory of a loaded library is, and may crash at the end of a program
# by looking there.
export ASAN_OPTIONS="${ASAN_OPTIONS:+$ASAN_OPTIONS:}intercept_tls_get_addr=0"
set -u
bin=$(realpath "$1")
here=$(mktemp -d)
cd "$here" || exit 2
export GSD_ENDPOINT=unix:$here/gsd.sock
gsctl=$bin/gsctl
limit=60 # seconds, for what must come

die() { echo "line ${BASH_LINENO[0]}: $*" >&2; exit 1; }

start_gsd() {
  "$bin/gsd" --socket-path "$here/gsd.sock" 2>>gsd.log &
  gsd=$!
  await "$gsctl" --timeout 5 wait nobody --gone
}

# await COMMAND...: until it succeeds.
await() {
  local end=$((SECONDS + limit))
  until "$@" >/dev/null 2>&1; do
    [ $SECONDS -lt $end ] || die "in vain: $*"
    sleep 0.02
  done
}
has() { grep -Eqs -- "$1" "$2"; }
await_text() { await has "$1" "$2"; } # TEXT FILE

# expect STATUS TEXT COMMAND...: that it ends so, and that what it says, on either output, has the text.
expect() {
  local status=$1 text=$2 said
  shift 2
  said=$("$@" 2>&1 </dev/null)
  local is=$?
  [ $is -eq "$status" ] || die "status $is instead of $status: $* said $said"
  [[ $said =~ $text ]] || die "no \"$text\" in what $* said: $said"
}

finish() {
  local status=$?
  local left
  left=$(jobs -p)
  [ -z "$left" ] || kill -CONT $left 2>/dev/null
  [ -z "$left" ] || kill -KILL $left 2>/dev/null
  wait 2>/dev/null
  [ $status -eq 0 ] || tail -n 50 ./*.log >&2 2>/dev/null
  cd / && rm -rf "$here"
}
trap finish EXIT
