#!/usr/bin/env bash
# Benchmark of fsquery against find, and fd and plocate where installed.
#
#   bench/fsquery_bench.sh [ENTRIES]
#
# Builds a synthetic tree of ENTRIES entries (default 200000) with gen_tree,
# then times, in one run and on the same tree: the first fsquery run (walk,
# lstat of every entry, tables and indexes written), the same query again
# (served from the cache), an exact-name query answered through the index, a
# wildcard query, a query sorted by size through the result file and the same
# query piped to sort(1), and the same questions put to find, fd and plocate;
# then the result file's sort alone against sort(1) (resultsort_bench).  Each
# command runs RUNS times (default 5); the table gives the median wall time and
# the peak resident memory over the runs, then the ratios the tool is held to.
#
# Environment: BUILD (build directory with fsquery and gen_tree, default
# "build"), WORK (where the tree, the cache and the plocate database go,
# default "$BUILD/bench-work"; not under /tmp, which updatedb prunes), RUNS.
# Every command's output goes to /dev/null; the hit counts are checked against
# find's before the timing starts.
set -euo pipefail

ENTRIES=${1:-200000}
BUILD=${BUILD:-build}
RUNS=${RUNS:-5}
WORK=${WORK:-$BUILD/bench-work}

FSQ=$BUILD/fsquery
GEN=$BUILD/gen_tree
for program in "$FSQ" "$GEN"; do
    if [ ! -x "$program" ]; then
        echo "fsquery_bench: $program is missing; build first (make build)" >&2
        exit 1
    fi
done

mkdir -p "$WORK"
WORK=$(cd "$WORK" && pwd)
TREE=$WORK/tree-$ENTRIES
CACHE=$WORK/cache-$ENTRIES
DB=$WORK/plocate-$ENTRIES.db
if [ ! -d "$TREE" ]; then
    echo "fsquery_bench: generating $ENTRIES entries in $TREE"
    "$GEN" "$TREE" "$ENTRIES"
fi

FD=""
if command -v fdfind >/dev/null 2>&1; then FD=fdfind; elif command -v fd >/dev/null 2>&1; then FD=fd; fi
PLOCATE=""
if command -v plocate >/dev/null 2>&1 && command -v updatedb >/dev/null 2>&1; then PLOCATE=plocate; fi

# ---------------------------------------------------------------- sanity
rm -rf "$CACHE"
fsq_files=$("$FSQ" --cache "$CACHE" "$TREE" | wc -l)
find_files=$(find "$TREE" ! -type d | wc -l)
fsq_c=$("$FSQ" --cache "$CACHE" --name '*.c' "$TREE" | wc -l)
find_c=$(find "$TREE" ! -type d -name '*.c' | wc -l)
fsq_needle=$("$FSQ" --cache "$CACHE" --name needle.conf "$TREE" | wc -l)
echo "fsquery_bench: tree $TREE: $find_files files; hits fsquery/find: all $fsq_files/$find_files," \
     "*.c $fsq_c/$find_c, needle.conf $fsq_needle/1"
if [ "$fsq_files" != "$find_files" ] || [ "$fsq_c" != "$find_c" ] || [ "$fsq_needle" != 1 ]; then
    echo "fsquery_bench: fsquery and find disagree; the timings would compare different work" >&2
    exit 1
fi

# -------------------------------------------------------------- measuring
# measure NAME PREPARE COMMAND...: runs PREPARE (a shell snippet, may be ":")
# and then COMMAND, RUNS times; records the median time and the peak memory.
declare -A TIME MEM
ORDER=()
measure() {
    local name=$1 prepare=$2
    shift 2
    local times=() peak=0 line seconds kib status
    for ((i = 0; i < RUNS; i++)); do
        eval "$prepare"
        line=$("$GEN" --measure -- "$@")
        read -r seconds kib status <<<"$line"
        if [ "$status" != 0 ]; then
            echo "fsquery_bench: '$*' exited with $status" >&2
            exit 1
        fi
        times+=("$seconds")
        if [ "$kib" -gt "$peak" ]; then peak=$kib; fi
    done
    TIME[$name]=$(printf '%s\n' "${times[@]}" | sort -g | awk '{a[NR]=$1} END {print a[int((NR+1)/2)]}')
    MEM[$name]=$peak
    ORDER+=("$name")
}

measure "find: path, size, mode of every entry" ":" find "$TREE" -printf '%p %s %m\n'
measure "fsquery: first run (cache build)" "rm -rf '$CACHE'" "$FSQ" --cache "$CACHE" "$TREE"
measure "fsquery: same query from the cache" ":" "$FSQ" --cache "$CACHE" "$TREE"
measure "fsquery: exact name (index)" ":" "$FSQ" --cache "$CACHE" --name needle.conf "$TREE"
measure "fsquery: wildcard *.c (cache)" ":" "$FSQ" --cache "$CACHE" --name '*.c' "$TREE"
measure "fsquery --no-cache: wildcard *.c" ":" "$FSQ" --no-cache --cache "$CACHE" --name '*.c' "$TREE"
measure "fsquery --sort size (cache)" ":" "$FSQ" --cache "$CACHE" --sort size "$TREE"
measure "fsquery | sort (cache)" ":" bash -c "'$FSQ' --cache '$CACHE' '$TREE' | sort"
measure "find: exact name" ":" find "$TREE" -name needle.conf
measure "find: wildcard *.c" ":" find "$TREE" ! -type d -name '*.c'
if [ -n "$FD" ]; then
    measure "$FD: exact name" ":" "$FD" -u -g needle.conf "$TREE"
    measure "$FD: wildcard *.c" ":" "$FD" -u -t f -t l -g '*.c' "$TREE"
fi
if [ -n "$PLOCATE" ]; then
    UPDATEDB=(updatedb -l 0 -U "$TREE" -o "$DB" --prunepaths "" --prunefs "" --prunenames ""
              --prune-bind-mounts no)
    measure "updatedb (plocate database)" "rm -f '$DB'" "${UPDATEDB[@]}"
    measure "plocate: substring needle.conf" ":" plocate -d "$DB" needle.conf
    measure "plocate: regex for *.c" ":" plocate -d "$DB" --regex '\.c$'
fi

# ----------------------------------------------------------------- report
echo
echo "Tree: $ENTRIES entries ($find_files files), $RUNS runs each, median wall time, peak RSS."
echo
echo "| Command | Median (s) | Peak RSS (MiB) |"
echo "|---|---:|---:|"
for name in "${ORDER[@]}"; do
    awk -v n="$name" -v t="${TIME[$name]}" -v m="${MEM[$name]}" \
        'BEGIN {printf "| %s | %.3f | %.1f |\n", n, t, m / 1024}'
done

ratio() {
    awk -v a="$1" -v b="$2" 'BEGIN {if (b > 0) printf "%.2f", a / b; else print "n/a"}'
}
verdict() {  # value op limit
    awk -v v="$1" -v l="$3" -v op="$2" 'BEGIN {
        ok = (op == "<=") ? (v <= l) : (v < l);
        print (v == "n/a") ? "not measured" : (ok ? "met" : "NOT met") }'
}
echo
echo "| Target | Ratio | Limit | Result |"
echo "|---|---:|---:|---|"
r=$(ratio "${TIME[fsquery: first run (cache build)]}" "${TIME[find: path, size, mode of every entry]}")
echo "| first run / find printing path, size, mode | $r | 1.3 | $(verdict "$r" "<=" 1.3) |"
if [ -n "$PLOCATE" ]; then
    r=$(ratio "${TIME[fsquery: wildcard *.c (cache)]}" "${TIME[plocate: regex for *.c]}")
    echo "| cached wildcard / plocate regex | $r | 1.0 (faster) | $(verdict "$r" "<" 1.0) |"
    r=$(ratio "${TIME[fsquery: exact name (index)]}" "${TIME[plocate: substring needle.conf]}")
    echo "| exact name via index / plocate substring | $r | 2.0 | $(verdict "$r" "<=" 2.0) |"
else
    echo "| cached wildcard / plocate regex | n/a | 1.0 | plocate not installed |"
    echo "| exact name via index / plocate substring | n/a | 2.0 | plocate not installed |"
fi
peak=0
for name in "${ORDER[@]}"; do
    case $name in fsquery*) if [ "${MEM[$name]}" -gt "$peak" ]; then peak=${MEM[$name]}; fi ;; esac
done
peak_mib=$(awk -v k="$peak" 'BEGIN {printf "%.1f", k / 1024}')
echo "| peak memory of any fsquery run (MiB) | $peak_mib | 64 | $(verdict "$peak_mib" "<" 64) |"

# ------------------------------------------------------------ result sort
# The sort of a result file alone against sort(1) on the same hits, in one
# run: medians of alternating rounds and their ratio (bench/resultsort_bench.cpp).
SORT_BENCH=$BUILD/resultsort_bench
if [ -x "$SORT_BENCH" ]; then
    echo
    rounds=$RUNS
    if [ "$rounds" -lt 5 ]; then rounds=5; fi
    "$SORT_BENCH" "$TREE" "$rounds"
fi
