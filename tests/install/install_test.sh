#!/usr/bin/env bash
# Installs the build into a temporary prefix and uses it as a host would:
# the example host built with CMake's find_package (shared and static) and with
# pkg-config, each run on a fixture tree; the installed fsquery, man page and
# bash completion; and the Debian packages' contents.
#
# Environment (set by CTest): BUILD_DIR, SOURCE_DIR, LIBDIR (relative library
# directory), CXX, HOST_CXXFLAGS, HOST_LDFLAGS (the build's own flags, so a
# sanitizer or 32-bit build links alike), TOOLCHAIN (may be empty) and
# FSCANNER_TEST_EMULATOR (runs programs of a cross build).
# Exit 0 passed, 1 failed, 77 skipped (only the package check skips, when
# dpkg-deb is missing).
set -u
fail=0
check() {  # check "what" command...
    local what=$1; shift
    if "$@"; then echo "ok: $what"; else echo "FAILED: $what"; fail=1; fi
}
run() { ${FSCANNER_TEST_EMULATOR:-} "$@"; }

work=$(mktemp -d "${TMPDIR:-/tmp}/fscanner-install-XXXXXX")
trap 'chmod -R u+rwx "$work" 2>/dev/null; rm -rf "$work"' EXIT
prefix=$work/prefix

cmake --install "$BUILD_DIR" --prefix "$prefix" >"$work/install.log" 2>&1 ||
    { cat "$work/install.log"; echo "FAILED: cmake --install"; exit 1; }

# --- what lands where ---------------------------------------------------------
for f in "$LIBDIR/libfscanner.so.0.2.0" "$LIBDIR/libfscanner.a" bin/fsquery \
         include/fscanner/fs/fs_query.h include/fscanner/fscommon/cache2.h \
         include/fscanner/base/kelmem.h share/man/man1/fsquery.1 \
         share/bash-completion/completions/fsquery "$LIBDIR/pkgconfig/fscanner.pc" \
         "$LIBDIR/cmake/fscanner/fscannerConfig.cmake" \
         "$LIBDIR/cmake/fscanner/fscannerConfigVersion.cmake" \
         "$LIBDIR/cmake/fscanner/fscannerTargets.cmake"; do
    check "installed $f" test -f "$prefix/$f"
done
check "SONAME link" test "$(readlink "$prefix/$LIBDIR/libfscanner.so.0")" = libfscanner.so.0.2.0
check "development link" test "$(readlink "$prefix/$LIBDIR/libfscanner.so")" = libfscanner.so.0
check "SONAME is libfscanner.so.0" \
    bash -c "objdump -p '$prefix/$LIBDIR/libfscanner.so.0.2.0' | grep -q 'SONAME *libfscanner.so.0$'"
# Internal headers stay inside.
check "no internal header installed" \
    test ! -e "$prefix/include/fscanner/fscommon/table.h" -a ! -e "$prefix/include/fscanner/fscommon/fsbuild.h"

# Every installed header compiles on its own with the package's flags: none
# of them needs a header that was not installed.
headers_ok=1
while IFS= read -r h; do
    if ! $CXX -std=c++17 $HOST_CXXFLAGS -D_FILE_OFFSET_BITS=64 -I"$prefix/include" \
            -I"$prefix/include/fscanner" -fsyntax-only -x c++ "$h" 2>"$work/header.err"; then
        echo "header does not compile alone: $h"; cat "$work/header.err"; headers_ok=0
    fi
done < <(find "$prefix/include" -name '*.h')
check "every installed header compiles alone" test $headers_ok = 1

# --- a fixture tree and what the hosts must print for it ------------------------
tree=$work/tree
mkdir -p "$tree/a/b" "$tree/c"
printf 'hello\n' >"$tree/a/one.txt"
printf 'x' >"$tree/a/b/two.c"
: >"$tree/c/empty"
head -c 5000 /dev/zero >"$tree/c/zeros.bin"
ln -s one.txt "$tree/a/link"
expected=$(find "$tree" ! -type d -printf '%p %s\n' | sort)
expected_c=$(find "$tree" ! -type d -name '*.c' -printf '%p %s\n' | sort)

# Runs a host twice on a cache of its own (the first run builds the cache,
# the second is served from it) and compares with find.  The hosts read this
# machine's mount table like any host; whether the fixture's file system counts
# as local (cached) or remote (walked directly), the answer is the same.
host_check() {
    local name=$1 exe=$2 cache=$work/cache-$1 out
    for round in build served; do
        out=$(cd "$work" && run "$exe" "$cache" "$tree" | sort)
        check "$name ($round) lists the fixture tree" test "$out" = "$expected"
    done
    out=$(cd "$work" && run "$exe" "$cache" "$tree" '[FILENAME]=="*.c"' | sort)
    check "$name answers an expression" test "$out" = "$expected_c"
}

# --- CMake find_package ---------------------------------------------------------
toolchain_arg=()
[ -n "${TOOLCHAIN:-}" ] && toolchain_arg=(-DCMAKE_TOOLCHAIN_FILE="$TOOLCHAIN")
if cmake -S "$SOURCE_DIR/tests/install/consumer" -B "$work/consumer" "${toolchain_arg[@]}" \
        -DCMAKE_PREFIX_PATH="$prefix" -DFSCANNER_EXAMPLE="$SOURCE_DIR/examples/host.cpp" \
        -DCMAKE_CXX_COMPILER="$CXX" -DCMAKE_CXX_FLAGS="$HOST_CXXFLAGS" \
        -DCMAKE_EXE_LINKER_FLAGS="$HOST_LDFLAGS" >"$work/consumer.log" 2>&1 &&
   cmake --build "$work/consumer" >>"$work/consumer.log" 2>&1; then
    echo "ok: example built with find_package"
    check "find_package carries _FILE_OFFSET_BITS=64" \
        grep -rq '_FILE_OFFSET_BITS=64' "$work/consumer/CMakeFiles/host_shared.dir/flags.make"
    host_check cmake-shared "$work/consumer/host_shared"
    host_check cmake-static "$work/consumer/host_static"
else
    cat "$work/consumer.log"; echo "FAILED: example built with find_package"; fail=1
fi
if cmake -S "$SOURCE_DIR/tests/install/consumer_wrong_major" -B "$work/wrong" "${toolchain_arg[@]}" \
        -DCMAKE_PREFIX_PATH="$prefix" >"$work/wrong.log" 2>&1; then
    echo "FAILED: find_package(fscanner 1.0) was accepted by a 0.2 package"; fail=1
else
    echo "ok: find_package(fscanner 1.0) refused"
fi

# --- pkg-config -------------------------------------------------------------------
export PKG_CONFIG_PATH="$prefix/$LIBDIR/pkgconfig"
if command -v pkg-config >/dev/null; then
    check "pkg-config knows version 0.2.0" test "$(pkg-config --modversion fscanner)" = 0.2.0
    check "pkg-config --cflags carries _FILE_OFFSET_BITS=64" \
        bash -c "pkg-config --cflags fscanner | grep -q -- -D_FILE_OFFSET_BITS=64"
    if $CXX -std=c++17 $HOST_CXXFLAGS $(pkg-config --cflags fscanner) "$SOURCE_DIR/examples/host.cpp" \
            $HOST_LDFLAGS $(pkg-config --libs fscanner) -Wl,-rpath,"$prefix/$LIBDIR" \
            -o "$work/host_pc" 2>"$work/pc.log"; then
        echo "ok: example built with pkg-config"
        host_check pkg-config "$work/host_pc"
    else
        cat "$work/pc.log"; echo "FAILED: example built with pkg-config"; fail=1
    fi
else
    echo "FAILED: pkg-config is missing"; fail=1
fi

# --- the tool, its man page and completion ----------------------------------------
check "installed fsquery tells its version" bash -c "${FSCANNER_TEST_EMULATOR:-} '$prefix/bin/fsquery' --version >/dev/null"
printf '/dev/sda1 / ext4 rw 0 0\n' >"$work/mtab"
out=$(run "$prefix/bin/fsquery" --mount-table "$work/mtab" --no-cache "$tree" | sort)
check "installed fsquery lists the fixture tree" \
    test "$out" = "$(find "$tree" ! -type d | sort)"
if command -v man >/dev/null; then
    man --warnings -l "$prefix/share/man/man1/fsquery.1" >"$work/man.out" 2>"$work/man.err"
    check "man renders the page" grep -q 'fsquery' "$work/man.out"
    check "man gives no warnings" test ! -s "$work/man.err"
    [ -s "$work/man.err" ] && cat "$work/man.err"
else
    echo "FAILED: man is missing"; fail=1
fi
completion=$prefix/share/bash-completion/completions/fsquery
check "completion registers" bash -c "source '$completion' && complete -p fsquery >/dev/null"
# Every option the tool's help names is in the man page and the completion.
options=$(run "$prefix/bin/fsquery" --help | grep -oE '(^|[ ,])--?[a-z][a-z0-9-]*' | sed 's/^[ ,]//' | sort -u)
for option in $options; do
    escaped=$(printf '%s' "$option" | sed 's/-/\\\\-/g')
    check "man page names $option" grep -q -- "$escaped" "$prefix/share/man/man1/fsquery.1"
    check "completion offers $option" grep -qE -- "(^|[ '])$option([ ']|\$)" "$completion"
done

# --- Debian packages --------------------------------------------------------------
if command -v dpkg-deb >/dev/null && command -v cpack >/dev/null; then
    if (cd "$work" && cpack -G DEB --config "$BUILD_DIR/CPackConfig.cmake" -B "$work/pkg") \
            >"$work/cpack.log" 2>&1; then
        listing=$(for deb in "$work"/pkg/*.deb; do dpkg-deb -c "$deb"; done)
        for f in "/usr/$LIBDIR/libfscanner.so.0.2.0" /usr/bin/fsquery /usr/share/man/man1/fsquery.1 \
                 "/usr/$LIBDIR/pkgconfig/fscanner.pc" "/usr/$LIBDIR/cmake/fscanner/fscannerConfig.cmake" \
                 /usr/include/fscanner/fs/fs_query.h "/usr/$LIBDIR/libfscanner.a"; do
            check "package holds $f" grep -q -- " \\.$f" <<<"$listing"
        done
        check "two packages: fscanner and fscanner-dev" \
            test "$(ls "$work/pkg" | grep -c '\.deb$')" = 2
    else
        cat "$work/cpack.log"; echo "FAILED: cpack"; fail=1
    fi
else
    echo "dpkg-deb or cpack is missing: the package check is skipped"
    [ $fail = 0 ] && exit 77
fi

exit $fail
