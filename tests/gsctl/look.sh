#!/bin/bash
# look.sh BIN: the commands that look, at a group with a slow voter and a member that dies.
. "$(dirname "$0")/daemon.sh"
export PATH=$bin:$bin/tests:$PATH
terminal=gsctl_terminal

# line STATUS TEXT COMMAND...: that it ends so and says one line with the text.
line() {
  expect "$@"
  [ "$(wc -l <<<"$("${@:3}" 2>&1 </dev/null)")" -eq 1 ] || die "more than a line: ${*:3}"
}

for command in status groups "members crew" nodes sessions stats watch "record crew -o never"; do
  line 3 'start gsd' gsctl $command
done
[ ! -e never ] || die "a recording was begun without a daemon"

start_gsd
[ "$(gsctl status | wc -l)" -eq 5 ] || die "status is not five lines"
line 1 "there is no group 'crew'" gsctl members crew
line 1 'a terminal is needed' gsctl top
line 2 'nan is no number' gsctl groups --watch --interval nan
line 1 'Bad file descriptor' eval 'gsctl groups >&-'

# Who is waited for: ben votes when there is a file, once for each of two phases.
gsctl record --all -o crew.record >record.log &
recorder=$!
gsctl watch --json >all.log &
await test -s crew.record
mkfifo orders
gsctl join crew --instance 1 --name ann <orders >ann.log &
exec 9>orders
await_text 'joined 1/1' ann.log
gsctl join crew --instance 2 --name ben --vote-with 'until [ -e go ]; do sleep 0.02; done' </dev/null >ben.log &
ben=$!
gsctl join $'other\033[31m' </dev/null >other.log &
await gsctl wait crew --members 2 --timeout 1
await has 'other\\u001b\[31m' <(gsctl groups --json)
if gsctl groups | grep -q $'\033'; then die "a group's name steers the terminal"; fi
echo "state ready" >&9
missing() { gsctl groups | grep -q '1 of 2 voted.*ben 2/1$'; }
await missing
[ "$(gsctl members crew --json | grep -o '"name":"[a-z]*"\|"vote":"[a-z]*"' | tr -d '\n')" = \
  '"name":"ann""vote":"voted""name":"ben""vote":"missing"' ] || die "members do not tell who has voted"

# The same live; what the screen shows, keys, sizes, and the terminal afterwards.
$terminal 80x24 gsctl top --interval 0.1 <<'END' || die "top"
expect crew                 2
expect : ben 2/1
keys \r
expect Group crew: 2 members
expect Waits for: ben 2/1
keys \e
gone Group crew
keys /oth\r
gone crew
expect filter: oth
keys \e
expect crew
keys s
expect sort: members
keys \t
expect To read
keys ?
expect look into a group
size 59x9
expect needs 60 x 10
lines 1
size 120x30
expect look into a group
signal 15
end 143
END
$terminal 40x9 gsctl top <<<$'expect too small\nend 1' || die "top in a small terminal"
touch go

# What has happened, and the picture of it.
await gsctl wait crew --state ready --timeout 1
kill -KILL $ben
await_text '"failure"' crew.record
await_text '"change":"left".*"why":"failed"' all.log
has '"change":"state","event":[0-9]*,"who":\[{"instance":1,.*"value":"ready"' all.log || die "no state in what watch says of all"
await gsctl wait crew --leader --timeout 1
kill -INT $recorder
wait $recorder || die "record ends with status $?"
gsctl chart crew.record --group crew -o crew.svg || die "no picture"
for text in 'waits [0-9.]* m?s for ben' 'state by ann: approved after' 'failure of ben: approved' 'class="failure"' '^</svg>$'; do
  has "$text" crew.svg || die "no '$text' in the picture"
done
if gsctl chart crew.record | grep -q $'\033'; then die "a name steers the terminal"; fi
line 1 'nothing happens' gsctl chart crew.record --from 1000 --to 1001
line 1 "group 'nobody'" gsctl chart crew.record --group nobody

# Files that are no recordings.
line 1 'No such file' gsctl chart nowhere
: >empty
line 1 'is empty' gsctl chart empty
line 1 'Is a directory' gsctl chart .
line 1 'no recording of gsctl: line 1' gsctl chart /dev/zero
line 1 'no recording of gsctl: line 1' gsctl chart ann.log
sed 's/"version":1/"version":2/' crew.record >later
line 1 'of version 2' gsctl chart later
sed 's/"group":"crew"/"group_base64":"Y3Jldw=="/' crew.record >encoded
cmp <(gsctl chart encoded --group crew) <(gsctl chart crew.record --group crew) || die "a name in base 64"
sed '2s/"time_us":[0-9]*/"time_us":"noon"/' crew.record >wrong
line 1 "line 2: 'time_us' is no number" gsctl chart wrong
head -c -20 crew.record >cut
line 0 'ends in the middle of a line' gsctl chart cut -o cut.svg

# Counts, as a collector of metrics reads them: a sample has the name that its type wants.
gsctl stats --openmetrics >metrics
[ "$(tail -1 metrics)" = "# EOF" ] || die "the metrics have no end"
awk '$2 == "TYPE" { type[$3] = $4; next } /^# (HELP|UNIT|EOF)/ { next }
     { name = $1; sub(/\{.*/, "", name); family = name; sub(/_(total|info)$/, "", family)
       wanted = type[family] == "counter" ? "_total" : type[family] == "info" ? "_info" : ""
       if (!(family in type) || name != family wanted || $NF !~ /^[0-9]+(\.[0-9]+)?$/) { print; wrong = 1 } }
     END { exit wrong }' metrics || die "no metric"
has '^gsd_failures_total 1$' metrics || die "the death of a member is not counted"

# Tables one after another, until there is no daemon any more; top and watch wait for it.
gsctl groups --watch --interval 0.05 >tables 2>lost &
watching=$!
again() { [ "$(grep -c ^Group tables)" -gt 2 ]; }
await again
mkfifo typed
$terminal 80x24 gsctl top --interval 0.1 <typed &
top=$!
exec 8>typed
printf 'expect crew\ntouch shown\n' >&8
await test -e shown
kill -KILL $gsd
wait $watching
[ $? -eq 5 ] && [ "$(wc -l <lost)" -eq 1 ] || die "the loss is told in another way: $(cat lost)"
printf 'expect tries again\n' >&8
await_text '"change":"lost"' all.log
start_gsd 8>&- # else gsd keeps the terminal's input open
await_text '"change":"found"' all.log
printf 'gone tries again\ngone crew\nkeys q\nend 0\n' >&8
exec 8>&-
wait $top || die "top does not come back"
