#!/usr/bin/env bash
# Benchmark of fsquery against find, plocate and fd, on generated trees.
#
#   bench/fsquery_bench.sh [ENTRIES]                 one size, the goal table
#   BENCH_SIZES="50000 200000 800000" bench/fsquery_bench.sh   scaling table
#
# One size (default 200000 entries): each job of the tool is timed against
# the peer that does the same job, in the same run, and the ratio is held to
# its goal:
#   first run       fsquery with no cache: walk, lstat of every entry, tables
#                   and indexes written; peer: find TREE -printf '%p %s %m\n'
#                   (walk and lstat of every entry).  Goal <= 1.0.
#   wildcard *.c    served from the cache; peer: plocate -r '\.c$' on a
#                   database of the same tree.  Goal <= 0.5.
#   exact name      needle.conf through the cache's name index; peer:
#                   plocate's substring search for that name.  Goal <= 1.5.
#   peak memory     the largest resident set of any fsquery run of the whole
#                   benchmark.  Goal < 64 MiB.
# fd (fdfind) runs in the same rounds where it does a comparable job, for
# information only.  Then, as details: the direct walk (--no-cache) against
# find and fd, --sort size against the unsorted answer piped to sort(1), and
# the result file's sort alone against sort(1) (resultsort_bench).
#
# Scaling (BENCH_SIZES set, sizes in entries): per size the first run, the
# served wildcard and the exact name against their peers, as nanoseconds per
# entry of the tree, with the ratios and the peak resident set per size.
#
# How it measures: every command runs with standard output on /dev/null
# through `gen_tree --measure`, which gives wall time and peak resident set
# (getrusage of the child).  The commands compared in one job run alternately
# in each round, and the order flips every round (A B, B A, ...), so that a
# change of load or of the page cache during the run hits both sides alike;
# the figure is the median of RUNS rounds (default 7).  Trees and the
# caches' page-cache state are warm: every command has read the tree at least
# once before the timing starts, when the hit counts of fsquery and of each
# peer are checked equal.  The load average is printed before and after.
#
# Environment: BUILD (build directory with fsquery and gen_tree, default
# "build"), WORK (trees, caches and plocate databases, default
# "$BUILD/bench-work"; not under /tmp, which updatedb prunes), RUNS,
# BENCH_SIZES, BENCH_DETAILS (0 leaves the detail rows out of the one-size
# run).  A tree is generated once per size, as WORK/tree-<entries>, and
# reused while it exists (gen_tree makes the same tree from the same size);
# its plocate database likewise.  Progress goes to standard error, the
# report to standard output.
set -euo pipefail

ENTRIES=${1:-200000}
BUILD=${BUILD:-build}
RUNS=${RUNS:-7}
WORK=${WORK:-$BUILD/bench-work}
BENCH_SIZES=${BENCH_SIZES:-}
BENCH_DETAILS=${BENCH_DETAILS:-1}

FSQ=$BUILD/fsquery
GEN=$BUILD/gen_tree
for program in "$FSQ" "$GEN"; do
    if [ ! -x "$program" ]; then
        echo "fsquery_bench: $program is missing; build first (make build)" >&2
        exit 1
    fi
done
FSQ=$(cd "$(dirname "$FSQ")" && pwd)/$(basename "$FSQ")
GEN=$(cd "$(dirname "$GEN")" && pwd)/$(basename "$GEN")
mkdir -p "$WORK"
WORK=$(cd "$WORK" && pwd)

FD=""
if command -v fdfind >/dev/null 2>&1; then FD=fdfind; elif command -v fd >/dev/null 2>&1; then FD=fd; fi
PLOCATE=""
if command -v plocate >/dev/null 2>&1 && command -v updatedb >/dev/null 2>&1; then PLOCATE=plocate; fi

progress() { echo "fsquery_bench: $*" >&2; }
die() {
    echo "fsquery_bench: $*" >&2
    exit 1
}
load() { uptime | sed 's/.*load average: */load average /'; }

# ------------------------------------------------------------------ trees
# use_tree N: sets TREE, CACHE, DB and TREE_ENTRIES (entries below the root)
# for the tree of N entries, generating it and its plocate database when they
# do not exist yet.  A tree is generated under a temporary name and renamed
# when complete, so an interrupted run never leaves a partial tree for reuse.
use_tree() {
    local n=$1
    TREE=$WORK/tree-$n
    CACHE=$WORK/cache-$n
    DB=$WORK/plocate-$n.db
    if [ ! -d "$TREE" ]; then
        rm -rf "$TREE.partial"
        progress "generating $n entries in $TREE (once; reused by later runs)"
        local start=$SECONDS
        "$GEN" "$TREE.partial" "$n" >&2
        mv "$TREE.partial" "$TREE"
        rm -f "$DB"
        progress "generated in $((SECONDS - start)) s"
    fi
    if [ -n "$PLOCATE" ] && [ ! -s "$DB" ]; then
        progress "building the plocate database $DB"
        updatedb -l 0 -U "$TREE" -o "$DB.partial" --prunepaths "" --prunefs "" --prunenames "" \
            --prune-bind-mounts no
        mv "$DB.partial" "$DB"
    fi
    TREE_ENTRIES=$(find "$TREE" -mindepth 1 | wc -l)
}

# check_counts: fsquery and each peer must find the same entries, or the
# timings would compare different work.  Reads the tree, the cache and the
# database once, so that the timed rounds start warm; leaves the cache built.
check_counts() {
    progress "checking hit counts on $TREE"
    rm -rf "$CACHE"
    local fsq_all find_all fsq_c find_c fsq_needle fsq_direct loc_c loc_needle fd_c fd_needle
    fsq_all=$("$FSQ" --cache "$CACHE" "$TREE" | wc -l)
    find_all=$(find "$TREE" ! -type d | wc -l)
    find "$TREE" -printf '%p %s %m\n' >/dev/null
    fsq_c=$("$FSQ" --cache "$CACHE" --name '*.c' "$TREE" | wc -l)
    find_c=$(find "$TREE" ! -type d -name '*.c' | wc -l)
    fsq_needle=$("$FSQ" --cache "$CACHE" --name needle.conf "$TREE" | wc -l)
    fsq_direct=$("$FSQ" --no-cache --name '*.c' "$TREE" | wc -l)
    local report="files fsquery/find $fsq_all/$find_all, *.c fsquery/--no-cache/find $fsq_c/$fsq_direct/$find_c"
    local bad=0
    [ "$fsq_all" = "$find_all" ] && [ "$fsq_c" = "$find_c" ] && [ "$fsq_direct" = "$find_c" ] &&
        [ "$fsq_needle" = 1 ] || bad=1
    if [ -n "$PLOCATE" ]; then
        loc_c=$(plocate -d "$DB" -r '\.c$' | wc -l)
        loc_needle=$(plocate -d "$DB" needle.conf | wc -l)
        report="$report, *.c plocate $loc_c, needle.conf fsquery/plocate $fsq_needle/$loc_needle"
        [ "$loc_c" = "$fsq_c" ] && [ "$loc_needle" = "$fsq_needle" ] || bad=1
    fi
    if [ -n "$FD" ]; then
        fd_c=$("$FD" -u -t f -t l -g '*.c' "$TREE" | wc -l)
        fd_needle=$("$FD" -u -g needle.conf "$TREE" | wc -l)
        report="$report, *.c fd $fd_c, needle.conf fd $fd_needle"
        [ "$fd_c" = "$fsq_c" ] && [ "$fd_needle" = "$fsq_needle" ] || bad=1
    fi
    progress "$report"
    [ "$bad" = 0 ] || die "fsquery and a peer disagree on the hits; the timings would compare different work"
    HITS_C=$fsq_c
}

# -------------------------------------------------------------- measuring
# run_once PREPARE ARRAY: runs the shell snippet PREPARE (untimed), then the
# command held in the array named ARRAY; sets LAST_TIME (s) and LAST_KIB.
run_once() {
    local prepare=$1
    local -n command=$2
    local line status
    eval "$prepare"
    line=$("$GEN" --measure -- "${command[@]}")
    read -r LAST_TIME LAST_KIB status <<<"$line"
    [ "$status" = 0 ] || die "'${command[*]}' exited with $status"
}

median() { printf '%s\n' "$@" | sort -g | awk '{a[NR] = $1} END {m = int((NR + 1) / 2); print (NR % 2) ? a[m] : (a[m] + a[m + 1]) / 2}'; }

# alternate JOB PREPARE_1 ARRAY_1 PREPARE_2 ARRAY_2 ...: RUNS rounds of the
# commands one after the other, in reverse order every other round.  Sets
# TIME[JOB/i] (median seconds) and KIB[JOB/i] (peak resident KiB over the
# rounds) for each command i, counted from 1.
declare -A TIME KIB
declare -A JOB_NAME=([first]="first run" [wild]="served *.c" [exact]="exact name"
                     [direct]="--no-cache *.c" [sort]="--sort size")
FSQ_PEAK_KIB=0
FSQ_PEAK_JOB=""
alternate() {
    local job=$1
    shift
    local prepares=() arrays=()
    while [ $# -gt 0 ]; do
        prepares+=("$1")
        arrays+=("$2")
        shift 2
    done
    local count=${#arrays[@]} round i k
    local -A times=()
    local -A peaks=()
    for ((round = 0; round < RUNS; round++)); do
        progress "$job: round $((round + 1))/$RUNS"
        for ((k = 0; k < count; k++)); do
            if ((round % 2 == 0)); then i=$k; else i=$((count - 1 - k)); fi
            run_once "${prepares[$i]}" "${arrays[$i]}"
            times[$i]="${times[$i]:-} $LAST_TIME"
            if [ "$LAST_KIB" -gt "${peaks[$i]:-0}" ]; then peaks[$i]=$LAST_KIB; fi
        done
    done
    for ((i = 0; i < count; i++)); do
        # shellcheck disable=SC2086
        TIME[$job/$((i + 1))]=$(median ${times[$i]})
        KIB[$job/$((i + 1))]=${peaks[$i]}
        local program
        eval "program=\${${arrays[$i]}[0]}"
        if [ "$program" = "$FSQ" ] && [ "${peaks[$i]}" -gt "$FSQ_PEAK_KIB" ]; then
            FSQ_PEAK_KIB=${peaks[$i]}
            FSQ_PEAK_JOB=${JOB_NAME[$job]}
        fi
    done
}

drop_cache() { rm -rf "$CACHE"; sync; }

# ------------------------------------------------------------- formatting
ms() { awk -v s="$1" 'BEGIN {printf "%.1f ms", s * 1000}'; }
mib() { awk -v k="$1" 'BEGIN {printf "%.1f MiB", k / 1024}'; }
ratio() { awk -v a="$1" -v b="$2" 'BEGIN {if (b > 0) printf "%.2f", a / b; else print "n/a"}'; }
verdict() { # value op limit
    awk -v v="$1" -v l="$3" -v op="$2" 'BEGIN {
        if (v == "n/a") { print "not measured"; exit }
        ok = (op == "<=") ? (v + 0 <= l + 0) : (v + 0 < l + 0);
        print ok ? "met" : "NOT met" }'
}
per_entry() { awk -v s="$1" -v n="$2" 'BEGIN {printf "%.0f", s * 1e9 / n}'; }

header() {
    echo "fsquery benchmark, $(date -u '+%Y-%m-%d %H:%M UTC'), $(nproc) CPUs, commit" \
         "$(git -C "$(dirname "$0")" rev-parse --short HEAD 2>/dev/null || echo unknown)$(
            git -C "$(dirname "$0")" diff --quiet HEAD 2>/dev/null || echo ' (with uncommitted changes)')"
    # shellcheck disable=SC2185
    echo "Peers: $(find --version | head -1); ${PLOCATE:+$(plocate --version | head -1); }${FD:+$($FD --version)}"
    echo "Before: $(load)"
    echo "Each figure: median of $RUNS alternated rounds, standard output to /dev/null, warm page cache."
}

# The commands, as arrays over the current TREE, CACHE and DB; alternate()
# takes them by name.
# shellcheck disable=SC2034,SC2016
set_commands() {
    FSQ_FIRST=("$FSQ" --cache "$CACHE" "$TREE")
    FIND_FIRST=(find "$TREE" -printf '%p %s %m\n')
    FD_FIRST=("$FD" -u . "$TREE")
    FSQ_WILD=("$FSQ" --cache "$CACHE" --name '*.c' "$TREE")
    LOC_WILD=(plocate -d "$DB" -r '\.c$')
    FD_WILD=("$FD" -u -t f -t l -g '*.c' "$TREE")
    FSQ_EXACT=("$FSQ" --cache "$CACHE" --name needle.conf "$TREE")
    LOC_EXACT=(plocate -d "$DB" needle.conf)
    FD_EXACT=("$FD" -u -g needle.conf "$TREE")
    FSQ_DIRECT=("$FSQ" --no-cache --name '*.c' "$TREE")
    FIND_WILD=(find "$TREE" ! -type d -name '*.c')
    FSQ_SORT=("$FSQ" --cache "$CACHE" --sort size "$TREE")
    FSQ_PIPE_SORT=(bash -c '"$0" --cache "$1" "$2" | LC_ALL=C sort' "$FSQ" "$CACHE" "$TREE")
}

# The three timed jobs of both modes.  Without plocate the two served jobs
# are timed alone; with fd (and WITH_FD=1) fd joins the rounds.
measure_jobs() {
    local with_fd=$1
    local fd_first=() fd_wild=() fd_exact=()
    if [ -n "$FD" ] && [ "$with_fd" = 1 ]; then
        fd_first=(":" FD_FIRST)
        fd_wild=(":" FD_WILD)
        fd_exact=(":" FD_EXACT)
    fi
    alternate first "drop_cache" FSQ_FIRST ":" FIND_FIRST "${fd_first[@]}"
    # The last round left a complete cache; the next two jobs are served.
    if [ -n "$PLOCATE" ]; then
        alternate wild ":" FSQ_WILD ":" LOC_WILD "${fd_wild[@]}"
        alternate exact ":" FSQ_EXACT ":" LOC_EXACT "${fd_exact[@]}"
    else
        alternate wild ":" FSQ_WILD "${fd_wild[@]}"
        alternate exact ":" FSQ_EXACT "${fd_exact[@]}"
    fi
}

# ---------------------------------------------------------- one size
one_size() {
    use_tree "$ENTRIES"
    set_commands
    check_counts
    header
    measure_jobs 1
    local loc_wild=n/a loc_exact=n/a fd_col_first="-" fd_col_wild="-" fd_col_exact="-"
    if [ -n "$PLOCATE" ]; then loc_wild=${TIME[wild/2]}; loc_exact=${TIME[exact/2]}; fi
    if [ -n "$FD" ]; then
        local fdi=2
        [ -n "$PLOCATE" ] && fdi=3
        fd_col_first=$(ms "${TIME[first/3]}")
        fd_col_wild=$(ms "${TIME[wild/$fdi]}")
        fd_col_exact=$(ms "${TIME[exact/$fdi]}")
    fi

    if [ "$BENCH_DETAILS" = 1 ]; then
        if [ -n "$FD" ]; then
            alternate direct ":" FSQ_DIRECT ":" FIND_WILD ":" FD_WILD
        else
            alternate direct ":" FSQ_DIRECT ":" FIND_WILD
        fi
        alternate sort ":" FSQ_SORT ":" FSQ_PIPE_SORT
    fi

    local after
    after=$(load)
    local r1 r2 r3 peak
    r1=$(ratio "${TIME[first/1]}" "${TIME[first/2]}")
    r2=n/a
    r3=n/a
    if [ -n "$PLOCATE" ]; then
        r2=$(ratio "${TIME[wild/1]}" "$loc_wild")
        r3=$(ratio "${TIME[exact/1]}" "$loc_exact")
        loc_wild=$(ms "$loc_wild")
        loc_exact=$(ms "$loc_exact")
    fi
    peak=$(awk -v k="$FSQ_PEAK_KIB" 'BEGIN {printf "%.1f", k / 1024}')

    echo "After:  $after"
    echo
    echo "Tree: $ENTRIES requested, $TREE_ENTRIES entries below the root ($(find "$TREE" ! -type d | wc -l) files," \
         "$HITS_C of them *.c), $TREE"
    echo
    echo "| Job | fsquery | peer | peer time | fd (info) | ratio | goal | result |"
    echo "|---|---:|---|---:|---:|---:|---|---|"
    # shellcheck disable=SC2028
    echo "| first run (walk, lstat, tables, indexes) | $(ms "${TIME[first/1]}") |" \
         "\`find TREE -printf '%p %s %m\\n'\` | $(ms "${TIME[first/2]}") | $fd_col_first | $r1 | <= 1.0 |" \
         "$(verdict "$r1" "<=" 1.0) |"
    echo "| wildcard \`*.c\` served from the cache | $(ms "${TIME[wild/1]}") | \`plocate -r '\\.c\$'\` |" \
         "$loc_wild | $fd_col_wild | $r2 | <= 0.5 | $(verdict "$r2" "<=" 0.5) |"
    echo "| exact name through the index | $(ms "${TIME[exact/1]}") | \`plocate needle.conf\` |" \
         "$loc_exact | $fd_col_exact | $r3 | <= 1.5 | $(verdict "$r3" "<=" 1.5) |"
    echo "| peak memory of any fsquery run | $peak MiB | (largest: $FSQ_PEAK_JOB) | | | | < 64 MiB |" \
         "$(verdict "$peak" "<" 64) |"
    echo
    echo "Peak resident set per command (largest over the rounds):"
    echo
    echo "| Job | fsquery | peer | fd |"
    echo "|---|---:|---:|---:|"
    local job
    for job in first wild exact; do
        echo "| ${JOB_NAME[$job]} | $(mib "${KIB[$job/1]}") | ${KIB[$job/2]:+$(mib "${KIB[$job/2]}")} |" \
             "${KIB[$job/3]:+$(mib "${KIB[$job/3]}")} |"
    done

    if [ "$BENCH_DETAILS" = 1 ]; then
        echo
        echo "Details (same rounds and medians):"
        echo
        echo "| Job | fsquery | peer | peer time | ratio |"
        echo "|---|---:|---|---:|---:|"
        echo "| direct walk, wildcard \`*.c\` (--no-cache) | $(ms "${TIME[direct/1]}") |" \
             "\`find TREE ! -type d -name '*.c'\` | $(ms "${TIME[direct/2]}") |" \
             "$(ratio "${TIME[direct/1]}" "${TIME[direct/2]}") |"
        if [ -n "$FD" ]; then
            echo "| direct walk, wildcard \`*.c\` (--no-cache) | $(ms "${TIME[direct/1]}") |" \
                 "\`$FD -u -t f -t l -g '*.c' TREE\` | $(ms "${TIME[direct/3]}") |" \
                 "$(ratio "${TIME[direct/1]}" "${TIME[direct/3]}") |"
        fi
        echo "| every entry from the cache, --sort size | $(ms "${TIME[sort/1]}") |" \
             "\`fsquery ... \\| LC_ALL=C sort\` (unsorted answer) | $(ms "${TIME[sort/2]}") |" \
             "$(ratio "${TIME[sort/1]}" "${TIME[sort/2]}") |"
        echo "| peak memory: direct walk, --sort size | $(mib "${KIB[direct/1]}"), $(mib "${KIB[sort/1]}") | | | |"

        # The sort of a result file alone against sort(1) on the same hits,
        # with alternating rounds of its own (bench/resultsort_bench.cpp).
        local sort_bench=$BUILD/resultsort_bench
        if [ -x "$sort_bench" ]; then
            progress "result-file sort against sort(1)"
            echo
            "$sort_bench" "$TREE" "$RUNS"
        fi
    fi
}

# ------------------------------------------------------------ scaling
scaling() {
    header
    local rows=() n
    for n in $BENCH_SIZES; do
        progress "size $n"
        use_tree "$n"
        set_commands
        check_counts
        FSQ_PEAK_KIB=0
        measure_jobs 0
        local first wild exact r1 r2="n/a" r3="n/a" pw="-" pe="-"
        first=$(per_entry "${TIME[first/1]}" "$TREE_ENTRIES")
        wild=$(per_entry "${TIME[wild/1]}" "$TREE_ENTRIES")
        exact=$(per_entry "${TIME[exact/1]}" "$TREE_ENTRIES")
        r1=$(ratio "${TIME[first/1]}" "${TIME[first/2]}")
        if [ -n "$PLOCATE" ]; then
            r2=$(ratio "${TIME[wild/1]}" "${TIME[wild/2]}")
            r3=$(ratio "${TIME[exact/1]}" "${TIME[exact/2]}")
            pw=$(per_entry "${TIME[wild/2]}" "$TREE_ENTRIES")
            pe=$(per_entry "${TIME[exact/2]}" "$TREE_ENTRIES")
        fi
        rows+=("| $TREE_ENTRIES | $first | $(per_entry "${TIME[first/2]}" "$TREE_ENTRIES") | $r1 | $wild | $pw | $r2 | $exact | $pe | $r3 | $(mib "$FSQ_PEAK_KIB") |")
        progress "size $n done: $(load)"
    done
    echo "After:  $(load)"
    echo
    echo "Nanoseconds per entry of the tree (median wall time / entries below the root);"
    echo "ratio = fsquery / peer; peers: find -printf for the first run, plocate for the other two."
    echo
    echo "| Entries | first run | find | ratio | served \`*.c\` | plocate | ratio | exact name | plocate | ratio | peak RSS |"
    echo "|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|"
    printf '%s\n' "${rows[@]}"
}

if [ -n "$BENCH_SIZES" ]; then
    scaling
else
    one_size
fi
