#!/bin/sh
# consume.sh CMAKE BUILD SOURCE COMPILER FLAGS: installs a build into a place of its own and builds
# and runs a consumer against it, once through the CMake package and once through pkg-config, and
# requires it from Lua interpreters.
set -eu
cmake=$1 build=$2 source=$3 compiler=$4 flags=$5
place=$(mktemp -d)
trap 'rm -rf "$place"' EXIT

# quietly COMMAND...: shows what the command prints only when it fails.
quietly() { "$@" >"$place/log" 2>&1 || { cat "$place/log"; exit 1; }; }

quietly "$cmake" --install "$build" --prefix "$place/installed"
# No installed header needs one that is not.
(cd "$place/installed/include/korvelscript" && find . -name '*.h' -printf '#include "%P"\n') \
    >"$place/headers.cpp"
quietly "$compiler" -std=c++20 -fsyntax-only -I"$place/installed/include/korvelscript" \
    "$place/headers.cpp"

printf 'assert(arg[1] == "word" and orv.getpid() > 0)\nreturn 7\n' >"$place/script.lua"

check() {
    [ "$("$1" | cut -d' ' -f1)" = 'consumer!' ] || { echo "$1 printed something else"; exit 1; }
    status=0
    "$1" "$place/script.lua" word || status=$?
    [ $status = 7 ] || { echo "$1 ended with $status"; exit 1; }
}

quietly "$cmake" -S "$source" -B "$place/build" -G Ninja -DCMAKE_PREFIX_PATH="$place/installed" \
    -DCMAKE_CXX_COMPILER="$compiler" -DCMAKE_CXX_FLAGS="$flags"
quietly "$cmake" --build "$place/build"
check "$place/build/consumer"

libdir=$(dirname "$(find "$place/installed" -name korvelscript.pc)")
PKG_CONFIG_PATH=$libdir
export PKG_CONFIG_PATH
# shellcheck disable=SC2046,SC2086
"$compiler" -std=c++20 $flags "$source/consumer.cpp" -o "$place/consumer" \
    $(pkg-config --cflags --libs korvelscript)
LD_LIBRARY_PATH=$(pkg-config --variable=libdir korvelscript)
export LD_LIBRARY_PATH
check "$place/consumer"

# As a Lua module, by either name. A sanitized library does not load into a plain program.
if [ -z "$flags" ]; then
    for folder in "$LD_LIBRARY_PATH" "$LD_LIBRARY_PATH/lua/5.1"; do
        for lua in luajit lua5.1; do
            LUA_CPATH="$folder/?.so" $lua -e 'assert(require "krscript" == orv)'
        done
    done
fi

unset LD_LIBRARY_PATH
"$place/installed/bin/oxscript" --version

# The manual page has every option of the tool, and no mistake that can be found here.
page=$place/installed/share/man/man1/oxscript.1
for option in $("$place/installed/bin/oxscript" --help | sed -n 's/^  \(-[-A-Za-z]*\).*/\1/p'); do
    sed 's/\\//g' "$page" | grep -q -e "$option" || { echo "$page has no $option"; exit 1; }
done
if command -v groff >/dev/null; then
    groff -man -Tutf8 -ww "$page" >"$place/page" 2>"$place/warnings"
    [ ! -s "$place/warnings" ] || { cat "$place/warnings"; exit 1; }
fi
grep -q "^ExecStart=$place/installed/bin/oxscript -s" \
    "$place/installed/lib/systemd/user/oxscript-server.service"
