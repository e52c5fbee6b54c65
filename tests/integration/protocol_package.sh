#!/bin/sh
# The protocol library as its users get it: installed to a scratch prefix, asked for by CMake and by pkg-config. Builds the
# examples and the listings of docs/protocol-library.md against it and runs them: examples and program as each other's peer,
# over TLS and plain.
#
#   protocol_package.sh BUILD SOURCE VERSION
#
# From the environment: CMAKE and READELF (the programs), CXX and CXXFLAGS (as for installed_package.sh), CMAKE_GENERATOR.
set -eu

build=$1
source=$2
version=$3
major=${version%%.*}
cmake=${CMAKE:-cmake}
readelf=${READELF:-readelf}
cxx=${CXX:-c++}
qel="$build/tools/qel/qel"

fail() {
    echo "protocol_package: FAILED: $*" >&2
    exit 1
}

# Runs a command quietly; shows what it printed if it fails.
quietly() {
    "$@" >"$work/log" 2>&1 || {
        cat "$work/log" >&2
        fail "$*"
    }
}

# Starts a command that prints the endpoint it listens on as its first line; sets $server and $endpoint.
serve() {
    : >"$work/endpoint"
    "$@" >"$work/endpoint" 2>"$work/server.log" <"$work/input" &
    server=$!
    tries=0
    until [ -s "$work/endpoint" ]; do
        tries=$((tries + 1))
        [ "$tries" -le 200 ] || {
            cat "$work/server.log" >&2
            fail "it does not listen: $*"
        }
        sleep 0.1
    done
    endpoint=$(sed -n 1p "$work/endpoint")
}

# Ends what serve() started and checks that it ended well.
stop() {
    kill "$server"
    wait "$server" || {
        cat "$work/server.log" >&2
        fail "the server ended with an error"
    }
    server=""
}

expect() {
    grep -qF -- "$1" "$work/out" || {
        cat "$work/out" >&2
        fail "expected to see: $1"
    }
}

work=$(mktemp -d "$build/protocol_package.XXXXXX")
server=""
finish() {
    [ -z "$server" ] || kill "$server" 2>/dev/null || true
    rm -rf "$work"
}
trap finish EXIT
trap 'exit 1' INT TERM
: >"$work/input"

# --- install

quietly "$cmake" --install "$build" --prefix "$work/prefix" --component qel_runtime
quietly "$cmake" --install "$build" --prefix "$work/prefix" --component qel_development
library=$(find "$work/prefix" -name libqelprotocol.so)
[ -n "$library" ] || fail "no libqelprotocol.so"
libdir=$(dirname "$library")
LD_LIBRARY_PATH="$libdir"
export LD_LIBRARY_PATH

soname=$("$readelf" -d "$library" | sed -n 's/.*SONAME.*\[\(.*\)\].*/\1/p')
[ "$soname" = "libqelprotocol.so.$major" ] || fail "the library calls itself '$soname'"
needed=$("$readelf" -d "$library" | sed -n 's/.*NEEDED.*\[\(.*\)\].*/\1/p' | sed 's/\.so.*//' | sort | tr '\n' ' ')
case $needed in
*ssl* | *crypto*) fail "it links more than the common library and the runtime: $needed" ;;
*libqelcommon*) ;;
*) fail "it does not link the common library: $needed" ;;
esac

# --- the component of the CMake package

# Asks for components; answers whether there is a target qel::protocol then.
gives_protocol() {
    rm -rf "$work/ask"
    mkdir "$work/ask"
    cat >"$work/ask/CMakeLists.txt" <<EOF
cmake_minimum_required(VERSION 3.20)
project(ask LANGUAGES CXX)
find_package(qel 1 REQUIRED $*)
if(NOT TARGET qel::common)
  message(FATAL_ERROR "no qel::common")
endif()
if(NOT TARGET qel::protocol)
  message(FATAL_ERROR "no qel::protocol")
endif()
EOF
    "$cmake" -S "$work/ask" -B "$work/ask/build" -DCMAKE_PREFIX_PATH="$work/prefix" >"$work/ask/log" 2>&1
}
gives_protocol COMPONENTS protocol || fail "the component protocol is not found"
gives_protocol COMPONENTS common protocol || fail "the components common and protocol are not found"
gives_protocol && fail "the package gives qel::protocol without being asked"
grep -q 'no qel::protocol' "$work/ask/log" || fail "the package without components is not found"
gives_protocol COMPONENTS other && fail "the package has a component that does not exist"

# --- the examples, by CMake and by pkg-config

quietly "$cmake" -S "$source/examples" -B "$work/examples" -DCMAKE_PREFIX_PATH="$work/prefix" -DCMAKE_BUILD_TYPE=Debug
quietly "$cmake" --build "$work/examples"
"$work/examples/in_memory" || fail "the example in memory fails"

PKG_CONFIG_PATH="$libdir/pkgconfig"
export PKG_CONFIG_PATH
[ "$(pkg-config --modversion qelprotocol)" = "$version" ] || fail "pkg-config tells another version"
eval "set -- $(pkg-config --cflags --libs qelprotocol)" # pkg-config writes words for a shell

# build NAME: a program from a source in $work, as a user would without CMake
build_with_pkg_config() {
    name=$1
    shift
    # shellcheck disable=SC2086 # CXXFLAGS are several words
    quietly "$cxx" -std=c++17 -Wall -Wextra -Wpedantic -Werror ${CXXFLAGS-} "$work/$name.cpp" -o "$work/$name" "$@"
}
cp "$source/examples/in_memory.cpp" "$work/by_pkg_config.cpp"
build_with_pkg_config by_pkg_config "$@"
"$work/by_pkg_config" || fail "the example in memory, built with pkg-config, fails"

# --- the examples and the program

cd "$work"
quietly "$qel" ca init authority --subject 'CN=Example root'
for name in server operator viewer; do
    quietly "$qel" ca issue authority "$name" --subject "CN=$name"
done
system=$(uname -srm)

serve "$qel" serve --credentials authority --name server --partition 1=/bin/sh
"$work/examples/console" "$endpoint" authority operator >"$work/out" || fail "the console does not work with qel serve"
expect "$system"
expect 'the command exited with status 0'
stop

serve "$qel" serve --plain --partition 1=/bin/sh
"$work/examples/console" "localhost:${endpoint##*:}" >"$work/out" || fail "the plain console does not work with qel serve"
expect "$system"
stop

serve "$work/examples/hypervisor" authority server
set -- --connect "$endpoint" --credentials authority --peer-name server
"$qel" call "$@" --name operator time >"$work/out" || fail "qel call does not work with the hypervisor"
expect 'Time of day (UTC):'
echo 'uname -srm; exit' | "$qel" console "$@" --name operator 1 >"$work/out" 2>"$work/log" ||
    fail "qel console does not work with the hypervisor"
expect "$system"
status=0
"$qel" console "$@" --name viewer 1 </dev/null >"$work/out" 2>&1 || status=$?
[ "$status" -eq 1 ] || fail "the hypervisor let a viewer in"
expect 'the server does not have partition 1'
"$work/examples/console" "$endpoint" authority operator >"$work/out" || fail "the examples do not work with each other"
expect "$system"
stop

serve "$work/examples/hypervisor"
echo 'uname -srm; exit' | "$qel" console --connect "$endpoint" --plain 1 >"$work/out" 2>"$work/log" ||
    fail "qel console does not work with the plain hypervisor"
expect "$system"
stop

# --- the listings of the guide

# Prints the listings that the guide marks with a word, such as "console: body".
listings() {
    awk -v mark="<!-- $1 -->" '$0 == mark { found = 1; next } found && /^```cpp$/ { on = 1; next }
        /^```$/ { on = 0; if (found) found = 0 } on' "$source/docs/protocol-library.md"
}
eval "set -- $(pkg-config --cflags --libs qelprotocol)"
for program in hypervisor console memory parts; do
    {
        listings 'both: top'
        listings "$program: top"
        echo 'int main(int, char** words)'
        echo 'try {'
        echo '    static_cast<void>(words);'
        listings "$program: body"
        echo '} catch (const std::exception& error) {'
        echo '    std::cerr << error.what() << std::endl;'
        echo '    return 1;'
        echo '}'
    } >"$work/guide_$program.cpp"
    [ "$(listings "$program: body" | wc -l)" -gt 5 ] || fail "the guide has no listings for $program"
    build_with_pkg_config "guide_$program" "$@"
done
marked=$(grep -c '^<!-- .* -->$' "$source/docs/protocol-library.md")
[ "$marked" -eq "$(grep -c '^```cpp$' "$source/docs/protocol-library.md")" ] || fail "a listing of the guide is not marked"

# The lines of README.md about both; it shows them without what comes before.
{
    listings 'both: top'
    echo 'void readme(const protocol::ServerOptions& serverOptions, const qel::PollFd& stop)'
    echo '{'
    awk '/^```cpp$/ { count++; on = 1; next } /^```$/ { on = 0 } on && count == 2' "$source/README.md"
    echo '}'
    echo 'int main() {}'
} >"$work/readme.cpp"
grep -q 'server.run(stop)' "$work/readme.cpp" || fail "README.md does not show a server"
build_with_pkg_config readme "$@"

"$work/guide_memory" >"$work/out" || fail "the guide's test in memory fails"
expect kept
"$work/guide_parts" >"$work/out" || fail "the guide's parts fail"
expect CN=server

mkfifo "$work/pipe"
rm "$work/input"
ln -s "$work/pipe" "$work/input"
(exec sleep 60) >"$work/pipe" & # keeps the pipe open until the console is done
holder=$!
serve "$work/guide_hypervisor"
"$work/guide_console" "$endpoint" >"$work/out" || {
    cat "$work/server.log" >&2
    fail "the guide's console fails"
}
kill "$holder"
wait "$server" || fail "the guide's hypervisor ended with an error"
server=""
cat >"$work/expected" <<EOF
connected to server, 9105-22A
it is after 1970
no partition 99: 1
consoles: 16
mode: 7
1, session closed: the command exited with status 3
the loop has its response: 1
EOF
diff "$work/expected" "$work/out" >&2 || fail "the guide's console printed something else"
grep -q '^operator has connected' "$work/endpoint" || fail "the guide's hypervisor did not see its console"
echo "protocol_package: PASSED"
