#!/bin/sh
# Installs the build into a fresh prefix and uses it as an outside host would: the README's C
# host built once through pkg-config and once through find_package, each run on a sample movie
# made by the installed tool, its output judged by ffprobe; then the installed Python module.
# usage: install_test.sh BUILD_DIR C_COMPILER SANITIZERS
set -eu
build=$1
cc=$2
sanitize=${3:-}
here=$(cd "$(dirname "$0")" && pwd)
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
prefix=$work/prefix

fail() { echo "FAILED: $*" >&2; exit 1; }

# The host is the README's example, word for word.
awk '/^```c$/ { inside = 1; next } /^```$/ && inside { exit } inside' "$here/../../README.md" | cmp -s - "$here/host.c" \
    || fail "tests/install/host.c differs from the README's C host example"

cmake --install "$build" --prefix "$prefix" >"$work/install.log" || { cat "$work/install.log"; fail "cmake --install"; }

# Exactly the public pieces: one header, the two libraries and the version links, and the
# reasons for the Python module (no development link: no host links them).
headers=$(cd "$prefix/include" && find . -type f | sort | tr '\n' ' ')
[ "$headers" = "./TqOVIXUtility.h " ] || fail "installed headers: $headers"
pc=$(find "$prefix" -name TqOVIXUtility.pc)
[ -n "$pc" ] || fail "no TqOVIXUtility.pc"
libdir=$(dirname "$(dirname "$pc")")
libraries=$(cd "$libdir" && find . -maxdepth 1 ! -type d | sort | tr '\n' ' ')
expected="./libOVIX.so ./libTqOVIXReasons.so.0 ./libTqOVIXReasons.so.0.1.0 ./libTqOVIXUtility.so ./libTqOVIXUtility.so.0 ./libTqOVIXUtility.so.0.1.0 "
[ "$libraries" = "$expected" ] || fail "installed libraries: $libraries"
readelf -d "$libdir/libTqOVIXUtility.so.0.1.0" | grep -q 'SONAME.*\[libTqOVIXUtility\.so\.0\]' || fail "SONAME"
[ "$(realpath "$(pkg-config --variable=reasonslibrary "$pc")")" = "$(realpath "$libdir/libTqOVIXReasons.so.0")" ] \
    || fail "pkg-config's reasonslibrary: $(pkg-config --variable=reasonslibrary "$pc")"
[ -f "$prefix/share/man/man1/tqovix.1" ] || fail "no manual page"

flags=""
[ -n "$sanitize" ] && flags="-fsanitize=$sanitize"

PKG_CONFIG_PATH=$(dirname "$pc")
export PKG_CONFIG_PATH
# shellcheck disable=SC2046,SC2086 # the flags are words
"$cc" -Wall -Wextra -Werror $flags -o "$work/host-pkgconfig" "$here/host.c" \
    $(pkg-config --cflags --libs TqOVIXUtility) -Wl,-rpath,"$(pkg-config --variable=libdir TqOVIXUtility)" \
    || fail "building the host with pkg-config"

cmake -S "$here/find_package" -B "$work/host-cmake" -DCMAKE_PREFIX_PATH="$prefix" -DCMAKE_C_COMPILER="$cc" \
    -DCMAKE_C_FLAGS="$flags" >"$work/cmake.log" 2>&1 || { cat "$work/cmake.log"; fail "configuring the find_package host"; }
cmake --build "$work/host-cmake" >"$work/cmake.log" 2>&1 || { cat "$work/cmake.log"; fail "building the find_package host"; }

case "$sanitize" in
*thread*)
    # Only the sanitizers the suites run the C hosts under are tried here.
    echo "SKIPPED: running the hosts under $sanitize (built only)"
    exit 77 ;;
esac

unset TQOVIX_UTILITY_LIBRARY LD_LIBRARY_PATH
# The run paths lead to the installed libraries, never back into the build tree.
for binary in "$prefix/bin/tqovix" "$libdir/libTqOVIXUtility.so.0" "$libdir/libTqOVIXReasons.so.0"; do
    for loaded in $(ldd "$binary" | awk '/lib(TqOVIXUtility|OVIX)\.so/ { print $3 }'); do
        [ "$(dirname "$(realpath "$loaded")")" = "$(realpath "$libdir")" ] || fail "$binary loads $loaded"
    done
done
"$prefix/bin/tqovix" make-sample "$work/sample.mov" --seconds 3 >/dev/null || fail "installed tqovix make-sample"

for host in "$work/host-pkgconfig" "$work/host-cmake/host"; do
    out=$work/$(basename "$(dirname "$host")")-$(basename "$host").mov
    printed=$("$host" "$work/sample.mov" "$out" 2>/dev/null) || fail "$host: $printed"
    [ "$printed" = "result 0" ] || fail "$host printed: $printed"
    judged=$(ffprobe -v error -show_entries stream=codec_type -of csv=p=0 "$out" 2>&1) || fail "ffprobe $out"
    [ "$judged" = "$(printf 'video\naudio')" ] || fail "ffprobe on $out: $judged"
    [ -z "$(ffprobe -v error -i "$out" 2>&1)" ] || fail "ffprobe complains about $out"
done

if [ -n "$sanitize" ]; then
    echo "installed, built twice and ran; the Python module is not tried: python3 cannot load a library built with -fsanitize=$sanitize"
    exit 0
fi
# The installed module finds the installed library by itself, and the job's output is refused
# as already processed.
PYTHONPATH=$prefix/lib/python3/dist-packages python3 - "$prefix" "$out" <<'EOF' || fail "installed Python module"
import os, sys
import tqovix_utility
prefix, processed = sys.argv[1], sys.argv[2]
loaded = os.path.realpath(tqovix_utility.library_path())
assert loaded.startswith(os.path.realpath(prefix) + os.sep), loaded
verdict = tqovix_utility.check(processed)
assert verdict == (20, "already processed") and verdict.reason == "already-processed", (verdict, verdict.reason)
reasons = [line for line in open("/proc/self/maps") if "libTqOVIXReasons" in line]
assert reasons and all(os.path.realpath(prefix) in line for line in reasons), reasons
EOF
echo "installed, built twice and ran"
