# Shared by tools/run and tools/test; sourced, never run.
# shellcheck shell=bash

TOP=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
# For the scripts that source this file.
# shellcheck disable=SC2034
{
    BUILD_PACKAGES=(g++ cmake ninja-build libsimpleini-dev libsodium-dev libpam0g-dev libcrypt-dev)
    TEST_PACKAGES=(libgtest-dev python3 python3-pytest python3-pytest-xdist perl procps strace)
    FUZZ_PACKAGES=(clang libclang-rt-dev llvm)
}

say() {
    printf '%s\n' "$*"
}

die() {
    printf '%s: %s\n' "${0##*/}" "$*" >&2
    exit 1
}

is_number() {
    [[ $1 =~ ^[0-9]{1,9}$ ]]
}

missing_packages() {
    local package status
    for package in "$@"; do
        status=$(dpkg-query -W -f '${db:Status-Status}' "$package" 2>/dev/null)
        [[ $status == installed ]] || printf '%s\n' "$package"
    done
}

# Installs those of the named Debian packages that are not there yet. Where all are, nothing is asked of apt.
need_packages() {
    if ! { command -v dpkg-query && command -v apt-get; } >/dev/null; then
        die "this is no Debian system. Needed are its packages: $*"
    fi
    local missing as_root=()
    mapfile -t missing < <(missing_packages "$@")
    [[ ${#missing[@]} -eq 0 ]] && return 0
    if [[ $EUID -ne 0 ]]; then
        # Without a terminal sudo must not wait for a password that nobody types.
        if ! command -v sudo >/dev/null || ! { sudo -n true 2>/dev/null || [[ -t 0 && -t 2 ]]; }; then
            die "packages are missing, and installing them needs root or sudo. As root, run:
    apt-get update && apt-get install ${missing[*]}"
        fi
        as_root=(sudo)
    fi
    say "Installing packages: ${missing[*]}"
    local apt=("${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get -q -o DPkg::Lock::Timeout=300)
    # An index that cannot be refreshed (a foreign source that is down) may still be good enough.
    "${apt[@]}" update || say "The package index could not be refreshed; trying with the one that is there."
    "${apt[@]}" install -y --no-install-recommends "${missing[@]}" ||
        die "the packages could not be installed: ${missing[*]}"
    mapfile -t missing < <(missing_packages "$@")
    [[ ${#missing[@]} -eq 0 ]] || die "still missing after the installation: ${missing[*]}"
}

# build_preset PRESET [TARGET...]: configures and builds.
build_preset() {
    local preset=$1 target arguments=()
    shift
    for target in "$@"; do
        arguments+=(--target "$target")
    done
    if command -v ccache >/dev/null; then
        export CMAKE_CXX_COMPILER_LAUNCHER=${CMAKE_CXX_COMPILER_LAUNCHER-ccache}
    fi
    cd "$TOP" || die "cannot enter $TOP"
    local place
    for place in build "build/$preset"; do
        [[ ! -e $place || -w $place ]] || die "$TOP/$place is not writable for you (made by root?)"
    done
    # A tree that was moved or copied with its build folder: the old configuration names the old place.
    local cache=build/$preset/CMakeCache.txt
    if [[ -f $cache ]] && ! grep -qxF "CMAKE_HOME_DIRECTORY:INTERNAL=$TOP" "$cache"; then
        rm -f "$cache"
    fi
    local said
    said=$(cmake --preset "$preset" 2>&1) || die "configuring the preset $preset failed:
$said"
    cmake --build "build/$preset" "${arguments[@]}" || die "building the preset $preset failed"
}
