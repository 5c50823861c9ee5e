#!/bin/bash
# cluster_shell.sh BIN: in a cluster of cluster.sh, a gsd on each host and a shell that is the first one's client.
set -eu
bin=$1
export CLUSTER=$(dirname "$(realpath "$0")")/cluster.sh
for h in 1 2 3; do
  "$CLUSTER" on $h "$bin/gsd" --ordering corosync --socket-path /run/gsd.sock 2>"/run/gsd.$h.log" &
done
# The first host's /run, as it is seen from here; on a host it is /run.
export GSD_ENDPOINT=unix:/run/cluster/1/run/gsd.sock PATH=$bin:$PATH
cat >/run/shell.rc <<'X'
on() { GSD_ENDPOINT=unix:/run/gsd.sock "$CLUSTER" on "$@"; }
cluster() { "$CLUSTER" "$@"; }
PS1='host 1 of 3: '
X
cat <<'X'
This is host 1 of three, each with a Corosync and a gsd. All is gone when you leave.
  member crew 1        a member here: "say hello" on its input, Ctrl-D ends it
  on 2 member crew 2   one on host 2; watcher crew sees what happens
  cluster cut 3        pull the cable of host 3; cluster heal: put it back
  cluster kill 2       kill Corosync on host 2; cluster start 2: start it again
  cat /run/gsd.2.log   the log of host 2's daemon
X
bash --rcfile /run/shell.rc -i || true
