#!/bin/sh
# Installs the library to a scratch prefix, moves the installed tree to another place, and builds and runs the example
# project against it there, once found by CMake and once by pkg-config; likewise the lines that README.md shows, with the
# includes of the example. Also installs and runs the program.
#
#   installed_package.sh BUILD SOURCE VERSION
#
# From the environment: CMAKE and READELF (the programs), CXX and CXXFLAGS (what the library was built with, as far as
# a program that links it needs the same), CMAKE_GENERATOR.
set -eu

build=$1
source=$2
version=$3
major=${version%%.*}
cmake=${CMAKE:-cmake}
readelf=${READELF:-readelf}
cxx=${CXX:-c++}

fail() {
    echo "installed_package: FAILED: $*" >&2
    exit 1
}

# Runs a command quietly; shows what it printed if it fails.
quietly() {
    "$@" >"$work/log" 2>&1 || {
        cat "$work/log" >&2
        fail "$*"
    }
}

work=$(mktemp -d "$build/installed_package.XXXXXX")
trap 'rm -rf "$work"' EXIT
trap 'exit 1' INT TERM

# --- install and move

quietly "$cmake" --install "$build" --prefix "$work/first" --component qel_runtime
quietly "$cmake" --install "$build" --prefix "$work/first" --component qel_development
moved="$work/second/place"
mkdir "$work/second"
mv "$work/first" "$moved"

library=$(find "$moved" -name libqelcommon.so)
[ -n "$library" ] || fail "no libqelcommon.so"
libdir=$(dirname "$library")
pcdir="$libdir/pkgconfig"

# --- what is there

soname=$("$readelf" -d "$library" | sed -n 's/.*SONAME.*\[\(.*\)\].*/\1/p')
[ "$soname" = "libqelcommon.so.$major" ] || fail "the library calls itself '$soname'"
[ "$(readlink "$library")" = "$soname" ] || fail "libqelcommon.so does not lead to $soname"
[ "$(readlink "$libdir/$soname")" = "libqelcommon.so.$version" ] || fail "$soname does not lead to version $version"
[ -f "$libdir/libqelcommon.so.$version" ] || fail "no libqelcommon.so.$version"

(cd "$source/headers/include" && find . -name '*.hpp') >"$work/headers.unsorted"
echo ./qel/common/QelVersion.hpp >>"$work/headers.unsorted"
sort "$work/headers.unsorted" >"$work/headers.expected"
(cd "$moved/include" && find . -type f) | sort >"$work/headers.installed"
diff "$work/headers.expected" "$work/headers.installed" >&2 || fail "the installed headers are not those of the project"

# --- the program and the documents are components of their own

if [ -e "$build/tools/qel/qel" ]; then
    quietly "$cmake" --install "$build" --prefix "$work/program" --component qel_runtime
    quietly "$cmake" --install "$build" --prefix "$work/program" --component qel_program
    mkdir "$work/apart"
    mv "$work/program" "$work/apart/program"
    [ "$("$work/apart/program/bin/qel" --version)" = "qel $version" ] || fail "the installed program does not run"
    [ ! -e "$work/apart/program/include" ] || fail "the program's component brings headers"
fi
quietly "$cmake" --install "$build" --prefix "$work/documents" --component qel_documentation
for file in LICENSE README.md CHANGELOG.md docs/tls.md docs/wire-format.md; do
    found=$(find "$work/documents/share/doc" -path "*/$file")
    [ -n "$found" ] || fail "$file was not installed"
    diff "$source/$file" "$found" >&2 || fail "another $file was installed"
done

# Nothing leads back to where it was built or first installed, and our warnings stay ours.
for place in "$source" "$build" "$work/first"; do
    if grep -rIlF "$place" "$moved" >&2; then fail "these files name $place"; fi
done
if grep -rIE -e '-W[a-z]|-fsanitize|--coverage' "$libdir/cmake" "$pcdir" >&2; then
    fail "our own flags reach the users"
fi

# --- found by CMake

quietly "$cmake" -S "$source/examples" -B "$work/by-cmake" -DCMAKE_PREFIX_PATH="$moved" -DCMAKE_BUILD_TYPE=Debug
quietly "$cmake" --build "$work/by-cmake"
"$work/by-cmake/send_receive" >"$work/by-cmake.out" || fail "the example built with CMake ended with an error"

# Asks for a version; answers whether the package takes it.
takes() {
    mkdir -p "$work/ask"
    cat >"$work/ask/CMakeLists.txt" <<EOF
cmake_minimum_required(VERSION 3.20)
project(ask LANGUAGES CXX)
find_package(qel $1 REQUIRED)
EOF
    rm -rf "$work/ask/build"
    "$cmake" -S "$work/ask" -B "$work/ask/build" -DCMAKE_PREFIX_PATH="$moved" >"$work/ask/log" 2>&1
}
takes "" || fail "the package is not found without a version"
takes "$version EXACT" || fail "the package does not take its own version"
takes "$((major + 1))" && fail "the package takes a newer major version"
takes "$major.999" && fail "the package takes a newer minor version"

# --- found by pkg-config

PKG_CONFIG_PATH="$pcdir"
export PKG_CONFIG_PATH
[ "$(pkg-config --modversion qel)" = "$version" ] || fail "pkg-config tells another version"
# Before glibc 2.34 the functions for threads are in a library of their own.
case " $(pkg-config --libs qel) " in
*" -pthread "*) ;;
*) fail "pkg-config does not name the threads of the C library" ;;
esac
eval "set -- $(pkg-config --cflags --libs qel)" # pkg-config writes words for a shell
# shellcheck disable=SC2086 # CXXFLAGS are several words
quietly "$cxx" -std=c++17 ${CXXFLAGS-} "$source/examples/send_receive.cpp" -o "$work/by-pkg-config" "$@"
LD_LIBRARY_PATH="$libdir" "$work/by-pkg-config" >"$work/by-pkg-config.out" ||
    fail "the example built with pkg-config ended with an error"
"$readelf" -d "$work/by-pkg-config" | grep NEEDED | grep -qF "[$soname]" || fail "the example does not need $soname"

# --- the first lines that README.md shows; protocol_package.sh has the others

# shellcheck disable=SC2016 # the backquotes are text
sed -n '/^```cpp$/,/^```$/{p;/^```$/q}' "$source/README.md" | sed '/^```/d' >"$work/lines"
[ -s "$work/lines" ] || fail "README.md shows no lines of code"
{
    grep '^#include' "$source/examples/send_receive.cpp"
    echo 'int main()'
    echo '{'
    cat "$work/lines"
    echo '}'
} >"$work/readme.cpp"
# shellcheck disable=SC2086
quietly "$cxx" -std=c++17 -Wall -Wextra -Werror ${CXXFLAGS-} "$work/readme.cpp" -o "$work/readme" "$@"
LD_LIBRARY_PATH="$libdir" "$work/readme" >"$work/readme.out" ||
    fail "the lines of README.md ended with an error"

# --- a program that uses TLS

mkdir "$work/tls"
cat >"$work/tls/CMakeLists.txt" <<EOF
cmake_minimum_required(VERSION 3.20)
project(tls LANGUAGES CXX)
find_package(qel REQUIRED)
add_executable(tls $source/tests/integration/installed_tls.cpp)
target_link_libraries(tls PRIVATE qel::common)
target_compile_options(tls PRIVATE -Wall -Wextra -Werror)
EOF
quietly "$cmake" -S "$work/tls" -B "$work/tls/by-cmake" -DCMAKE_PREFIX_PATH="$moved" -DCMAKE_BUILD_TYPE=Debug
quietly "$cmake" --build "$work/tls/by-cmake"
# shellcheck disable=SC2086
quietly "$cxx" -std=c++17 -Wall -Wextra -Werror ${CXXFLAGS-} "$source/tests/integration/installed_tls.cpp" \
    -o "$work/tls/by-pkg-config" "$@"
cat >"$work/tls/expected" <<EOF
connection: 1, key: 1
X509 certificate string is not in a supported format
EOF
"$work/tls/by-cmake/tls" >"$work/tls/by-cmake.out" || fail "the TLS program built with CMake ended with an error"
LD_LIBRARY_PATH="$libdir" "$work/tls/by-pkg-config" >"$work/tls/by-pkg-config.out" ||
    fail "the TLS program built with pkg-config ended with an error"
for way in by-cmake by-pkg-config; do
    diff "$work/tls/expected" "$work/tls/$way.out" >&2 || fail "the TLS program ($way) printed something else"
done

# --- what the example says

cat >"$work/expected" <<EOF
QEL common library $version
received [CID: 0x00000002, FN: 0x6003, OP: 0x0101, FL: 0x80, DL: 48, ST: 0x00000000:0000]
from tool console-1 of type 2
EOF
for way in by-cmake by-pkg-config; do
    diff "$work/expected" "$work/$way.out" >&2 || fail "the example ($way) printed something else"
done

echo '[CID: 0x00000002, FN: 0x6003, OP: 0x0101, FL: 0x80, DL: 48, ST: 0x00000000:0000] from console-1' |
    diff - "$work/readme.out" >&2 || fail "the lines of README.md printed something else"
echo "installed_package: PASSED"
