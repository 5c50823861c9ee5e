#!/bin/bash
# cluster_bench.sh BUILD_FOLDER [--nodes=N,...] [--delivery=HOW,...] [--table] [--quick] [--benchmark_out=FILE.json]
# measures groups over several hosts of this machine, a cluster of scripts/cluster.sh for each number of nodes (3) and
# delivery (safe,agreed); --table: all of it as one table in the end. JSON for each cluster: BUILD_FOLDER/bench or FILE,
# as in cluster.3.safe.json.
# Where there can be no such cluster it says why and ends with status 0.
. "$(dirname "$0")/common.sh"
bin=$1/bin/bench/cluster out=$1/bench/cluster.json
shift
nodes=3 deliveries=safe,agreed table= more=()
for word; do
  case $word in
  --nodes=*) nodes=${word#*=};;
  --delivery=*) deliveries=${word#*=};;
  --table) table=yes;;
  --benchmark_out=*) out=${word#*=};;
  *) more+=("$word");;
  esac
done

for program in corosync ip unshare; do
  command -v $program >/dev/null && continue
  echo "skipped: there is no $program; scripts/dependencies.sh cluster installs it"
  exit 0
done
export TOKEN=${TOKEN:-2000} WAIT=${WAIT:-60}
cluster=$PWD/scripts/cluster.sh
"$cluster" run 1 true </dev/null || { echo "skipped: no hosts can be made here, see above"; exit 0; }

mkdir -p "$(dirname "$out")"

# The last figure without indentation names those under it. A cell is the figures of all deliveries.
print_table() {
  awk -v nodes="$nodes" -v deliveries="$deliveries" -v out="${out%.json}" '
    function figure(line) { match(line, /"name": "[^"]*"/); return substr(line, RSTART + 9, RLENGTH - 10) }
    function field(line, name) {
      match(line, "\"" name "\": \"?[^,\"}]*")
      return substr(line, RSTART + length(name) + 4, RLENGTH - length(name) - 4)
    }
    function read(file, column,    line, name, key, value) {
      while ((getline line <file) > 0) {
        if (line !~ /"name"/) continue
        name = figure(line)
        if (name !~ /^ /) top = name
        key = top "|" name
        if (!(key in unit)) { row[++rows] = key; text[key] = name }
        unit[key] = field(line, "unit"); sub(/^"/, "", unit[key])
        value = field(line, "measured") + 0
        cell[key, column] = sprintf(value < 100 ? "%.3g" : "%.0f", value)
      }
    }
    BEGIN {
      n = split(nodes, node, ","); d = split(deliveries, how, ",")
      for (i = n; i >= 1; i--) for (j = 1; j <= d; j++) read(out "." node[i] "." how[j] ".json", i SUBSEP j)
      gsub(",", " / ", deliveries)
      printf "| %s | |", deliveries
      for (i = 1; i <= n; i++) printf " %s |", node[i] (node[i] == 1 ? " host" : " hosts")
      printf "\n|---|---|"; for (i = 1; i <= n; i++) printf "---|"; print ""
      for (r = 1; r <= rows; r++) {
        key = row[r]; name = text[key]; sub(/^  /, "- ", name)
        printf "| %s | %s |", name, unit[key]
        for (i = 1; i <= n; i++) {
          line = ""
          for (j = 1; j <= d; j++) line = line (j > 1 ? " / " : "") ((key, i, j) in cell ? cell[key, i, j] : "-")
          printf " %s |", line
        }
        print ""
      }
    }'
}

status=0
for n in ${nodes//,/ }; do
  for delivery in ${deliveries//,/ }; do
    echo "-- $n hosts, $delivery"
    # Whatever this script dies of, the hosts die with it.
    setpriv --pdeathsig KILL "$cluster" run "$n" "$bin" --script="$cluster" --nodes="$n" --delivery="$delivery" \
      --benchmark_out="${out%.json}.$n.$delivery.json" ${more[@]+"${more[@]}"} </dev/null || status=1
  done
done
if [ -n "$table" ]; then echo; print_table; fi
exit $status
