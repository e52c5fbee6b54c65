#!/bin/sh
# The library as a part of a larger project: once shared, once static. Its installation goes with that of the larger
# project, whose program runs from there, and the installed package serves others.
#
#   larger_project.sh SOURCE
#
# From the environment: CMAKE and CXX (the programs).
set -eu

source=$1
cmake=${CMAKE:-cmake}

fail() {
    echo "larger_project: FAILED: $*" >&2
    exit 1
}

# Runs a command quietly; shows what it printed if it fails.
quietly() {
    "$@" >"$work/log" 2>&1 || {
        cat "$work/log" >&2
        fail "$*"
    }
}

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
trap 'exit 1' INT TERM

mkdir "$work/larger"
cat >"$work/larger/CMakeLists.txt" <<EOF
cmake_minimum_required(VERSION 3.20)
project(larger LANGUAGES CXX)
add_subdirectory($source library)
add_executable(program $source/examples/send_receive.cpp)
target_link_libraries(program PRIVATE qel::common)
set_target_properties(program PROPERTIES INSTALL_RPATH "\\\$ORIGIN/../\${CMAKE_INSTALL_LIBDIR}")
install(TARGETS program)
EOF

for shared in ON OFF; do
    build="$work/build-$shared"
    prefix="$work/prefix-$shared"
    quietly "$cmake" -S "$work/larger" -B "$build" -DBUILD_SHARED_LIBS=$shared -DCMAKE_BUILD_TYPE=Debug \
        -DCMAKE_INSTALL_LIBDIR=lib
    quietly "$cmake" --build "$build" --parallel "$(nproc)"
    quietly "$cmake" --install "$build" --prefix "$prefix"
    rm -rf "$build" # the program must find what was installed
    "$prefix/bin/program" >"$work/out" || fail "the program of the larger project does not run (shared: $shared)"
    grep -q '^from tool console-1' "$work/out" || fail "the program printed something else (shared: $shared)"

    case $shared in
    ON) kind=so other=a ;;
    OFF) kind=a other=so ;;
    esac
    [ -e "$prefix/lib/libqelcommon.$kind" ] || fail "libqelcommon.$kind was not installed"
    [ ! -e "$prefix/lib/libqelcommon.$other" ] || fail "libqelcommon.$other was installed"
    [ ! -e "$prefix/bin/qel" ] || fail "the larger project built the program qel without being asked"

    quietly "$cmake" -S "$source/examples" -B "$work/user-$shared" -DCMAKE_PREFIX_PATH="$prefix" -DCMAKE_BUILD_TYPE=Debug
    quietly "$cmake" --build "$work/user-$shared"
    "$work/user-$shared/send_receive" >"$work/user" || fail "a user of the installed package does not run (shared: $shared)"
    diff "$work/out" "$work/user" >&2 || fail "a user of the installed package printed something else"
done

# The tests need the shared library; asking for both is answered with a sentence.
if "$cmake" -S "$source" -B "$work/tests" -DBUILD_SHARED_LIBS=OFF -DQEL_BUILD_TOOLS=OFF >"$work/log" 2>&1; then
    fail "the tests were configured for a static library"
fi
tr '\n' ' ' <"$work/log" | tr -s ' ' | grep -q 'with BUILD_SHARED_LIBS=OFF, set QEL_BUILD_TESTS=OFF' ||
    fail "no sentence for tests with a static library"
echo "larger_project: PASSED"
