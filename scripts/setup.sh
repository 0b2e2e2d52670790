# Shared by ./run, ./test and .ci/run, which source it with `root` set: installs packages, builds.
# Everything here writes to standard error, so that a script's own output stays clean.

run_packages="g++ cmake ninja-build pkg-config libedit-dev libluajit-5.1-dev lua-lpeg-dev libfribidi-dev zlib1g-dev libcjson-dev"
test_packages="$run_packages libgtest-dev locales luajit lua5.1 python3-minimal"

# need PACKAGE...: installs those that are missing, in one step.
need() {
    missing=
    for package; do
        state=$(dpkg-query -W -f='${db:Status-Status}' "$package" 2>/dev/null) || state=
        [ "$state" = installed ] || missing="$missing $package"
    done
    [ -n "$missing" ] || return 0
    as_root=
    if [ "$(id -u)" != 0 ]; then
        as_root=sudo
        command -v sudo >/dev/null || {
            echo "These packages are missing, and installing them needs root or sudo:$missing" >&2
            exit 1
        }
    fi
    echo "Installing packages:$missing" >&2
    apt="$as_root env DEBIAN_FRONTEND=noninteractive apt-get -qq -o DPkg::Lock::Timeout=600"
    # shellcheck disable=SC2086
    { $apt update && $apt install -y --no-install-recommends $missing; } >&2
}

# build PRESET [TARGET...]: configures when that has not been done with the same KORVEL_CMAKE_ARGS,
# and builds when there is work.
# Two at a time on one folder wait for each other.
build() {
    preset=$1
    shift
    folder=$root/build/$preset
    mkdir -p "$folder"
    (
        flock 9
        arguments=$(cat "$folder/arguments" 2>/dev/null) || arguments=
        if [ ! -f "$folder/build.ninja" ] || [ "$arguments" != "${KORVEL_CMAKE_ARGS:-}" ]; then
            echo "Configuring the $preset build" >&2
            # shellcheck disable=SC2086
            (cd "$root" && cmake --preset "$preset" ${KORVEL_CMAKE_ARGS:-}) \
                >"$folder/configure.log" 2>&1 || {
                cat "$folder/configure.log" >&2
                exit 1
            }
            echo "${KORVEL_CMAKE_ARGS:-}" >"$folder/arguments"
        fi
        ninja -C "$folder" -n "$@" 2>&1 | grep -q 'no work to do' || ninja -C "$folder" "$@" >&2
    ) 9>"$folder/.lock"
}
