# shellcheck shell=bash
# What the scripts share. Sourced, with `set -euo pipefail` in force; changes no directory of the caller.

top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
release=$top/build/release
stamp=$release/.memweight-built

fail() {
    echo "memweight: $*" >&2
    exit 1
}

# Runs a command; its output is shown, on standard error, only if it fails.
quietly() {
    local output
    if ! output=$("$@" 2>&1 </dev/null); then
        printf '%s\n' "$output" >&2
        return 1
    fi
}

# Those that the lists name and that are not installed.
missing_packages() {
    local package
    cat "$@" | sed 's/#.*//' | while read -r package; do
        if [[ -n $package && $(dpkg-query -W -f='${db:Status-Status}' "$package" 2>/dev/null) != installed ]]; then
            echo "$package"
        fi
    done
}

# What dependencies.txt names, and further lists of the same form.
install_dependencies() {
    local missing
    local -a packages as_root=()
    missing=$(missing_packages "$top/dependencies.txt" "$@")
    [[ -n $missing ]] || return 0
    mapfile -t packages <<<"$missing"
    if ((EUID != 0)); then
        command -v sudo >/dev/null || fail "only root can install what is missing: ${packages[*]}"
        as_root=(sudo)
    fi
    echo "installing: ${packages[*]}" >&2
    local -a apt=("${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get -y -o DPkg::Lock::Timeout=300)
    quietly "${apt[@]}" update || fail "the lists of packages could not be fetched"
    quietly "${apt[@]}" install --no-install-recommends "${packages[@]}" ||
        fail "these packages could not be installed: ${packages[*]}"
}

# One build at a time: several scripts may be started at once.
with_build_lock() {
    if ! mkdir -p "$release" 2>/dev/null || [[ ! -w $release ]]; then
        fail "$release cannot be written by this user: build once as its owner, with scripts/build"
    fi
    (
        cd "$top" && flock 9 && "$@"
    ) 9>"$release/.lock"
}

# The steps of a build are joined with && because bash ignores `set -e` in a function that `quietly` calls.

# Tests that were configured once stay configured: CMake deletes what is no longer part of the build.
_configure_release() {
    if [[ ! -f $release/build.ninja ]]; then
        cmake --preset release -DMEMWEIGHT_TESTS=OFF
    elif [[ CMakePresets.json -nt $release/build.ninja ]]; then
        cmake --preset release
    fi && ln -sfn build/release/compile_commands.json compile_commands.json
}

_build_release() {
    # A source that is changed while the build runs is newer than the moment when it began.
    touch "$stamp.new" &&
        _configure_release &&
        cmake --build --preset release --target memweight memweight-heapsnap &&
        mv "$stamp.new" "$stamp"
}

build_release() {
    with_build_lock _build_release
}

# Whether build/release/memweight is there and newer than everything that it is made of.
is_built() {
    [[ -x $release/memweight && -x $release/memweight-heapsnap && -f $stamp ]] || return 1
    [[ -z $(find "$top/src" "$top/CMakeLists.txt" "$top/CMakePresets.json" "$top/dependencies.txt" \
        -newer "$stamp" -print -quit) ]]
}
