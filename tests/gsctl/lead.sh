#!/bin/bash
# lead.sh BIN: candidates are killed and stopped, their programs are killed, gsd is started again: at every moment at
# most one program runs that holds the newest fence, and one comes to run again.
. "$(dirname "$0")/daemon.sh"

# What leads: it says so in a file that all of them append to, and whether another with its fence, or with a newer one,
# is there. It leaves a process in a group of its own behind.
cat >work <<'X'
#!/bin/bash
while read -r what fence pid; do
  [ "$what" = begin ] || continue
  [ "$fence" -ne "$GS_FENCE" ] || ! kill -0 "$pid" 2>/dev/null || echo "twice $GS_FENCE $pid $$" >>fences
done <fences
echo "begin $GS_FENCE $$ $GS_GROUP $GS_MEMBER" >>fences
setsid sleep 1000 &
echo "sleep $!" >>strays
wait
X
chmod +x work
: >fences

newest() { tail -n 1 fences; }
field() { newest | cut -d' ' -f"$1"; }
begun() { [ "$(grep -c begin fences)" -gt "$1" ]; }

# another DISTURBANCE...: that after it one program more is started, with no older fence than the last.
another() {
  local count
  count=$(grep -c begin fences)
  "$@"
  await begun "$count"
}

declare -A candidate # by what they are told to be
stand() {            # NAME OPTION...
  local name=$1
  shift
  "$gsctl" lead work --name "$name" --restart --grace 1 "$@" -- ./work >"$name.log" 2>&1 &
  candidate[$name]=$!
}
leader() { # the name of the one that leads
  local name
  for name in "${!candidate[@]}"; do
    ! has "leads 'work', fence $(field 2)\$" "$name.log" || echo "$name"
  done
}
dead() { ! kill -0 "$1" 2>/dev/null; }

start_gsd
another stand a --responsive 2
stand b --responsive 2
await "$gsctl" wait work --members 2 --timeout 1
stand c --responsive 2
await "$gsctl" wait work --members 3 --timeout 1

# The program is killed: started again by the same leader.
member=$(field 5)
another kill -KILL "$(field 3)"
[ "$(field 5)" = "$member" ] || die "another leads though only the program was killed"

# The leader is killed, and stopped: another leads, the program and what it started are gone.
old=$(field 3)
was=$(leader)
another kill -KILL "${candidate[$was]}"
await dead "$old"
stand "$was" --responsive 2
await "$gsctl" wait work --members 3 --timeout 1
old=$(field 3)
was=$(leader)
another kill -STOP "${candidate[$was]}"
dead "$old" || die "the program of a stopped leader ran on when another led"
kill -CONT "${candidate[$was]}"
await "$gsctl" wait work --members 3 --timeout 1

# gsd is killed.
restart_gsd() {
  kill -KILL $gsd
  wait $gsd 2>/dev/null
  start_gsd
}
another restart_gsd
await "$gsctl" wait work --members 3 --timeout 1
another "$gsctl" expel work "$(field 5)" >/dev/null

# Nobody stands any more: what they started is gone, with their own status.
kill "${candidate[@]}"
for name in "${!candidate[@]}"; do wait "${candidate[$name]}"; done
while read -r _ _ pid _; do dead "$pid" || die "a program outlived its candidate"; done < <(grep begin fences)
while read -r _ pid; do dead "$pid" || die "a process outlived the program that started it"; done <strays
! has twice fences || die "two programs with one fence: $(cat fences)"
sort -c -s -n -k2,2 fences || die "a fence went back: $(cat fences)"

# Once each, in turn; the status is the program's.
"$gsctl" lock turn -- sh -c 'until [ -e go ]; do sleep 0.02; done; echo first >>turns; exit 7' &
first=$!
await "$gsctl" wait turn --members 1 --timeout 1
expect 4 'time is over' "$gsctl" lock turn --timeout 0.1 -- touch never
"$gsctl" lock turn -- sh -c 'echo second >>turns' &
second=$!
await "$gsctl" wait turn --members 2 --timeout 1
touch go
wait $first
[ $? -eq 7 ] || die "the status of CMD"
wait $second || die "the second in turn"
[ "$(cat turns)" = $'first\nsecond' ] && [ ! -e never ] || die "turns"
expect 127 'cannot run .*/nothing: No such file' "$gsctl" lead turn --restart -- ./nothing
expect 126 'Permission denied' "$gsctl" lead turn -- /etc/passwd

# Without --restart the lead that is lost ends it; a program that does not end by SIGTERM is killed.
"$gsctl" lead solo --grace 0.1 -- sh -c 'trap "" TERM; touch on; while :; do sleep 0.05; done' 2>solo.log &
solo=$!
await test -e on
kill -KILL $gsd
wait $solo
[ $? -eq 5 ] || die "the status of a candidate that lost the daemon"
has 'no longer leads: the daemon is gone' solo.log || die "no word of it"
