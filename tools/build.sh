# What ./run and ./test share: the packages and the build folders. Sourced; $root is the checkout.

packages_to_build='g++ cmake ninja-build pkg-config libbsd-dev libelf-dev nlohmann-json3-dev'
packages_to_test="$packages_to_build libgtest-dev clang-format clang-tidy clang \
    libclang-rt-dev python3 python3-jsonschema bindfs"

# Sees to it that the named Debian packages are there: root installs what is missing, others are told.
# Elsewhere than on Debian it is left to CMake to say what it lacks.
require_packages() {
    command -v dpkg-query > /dev/null || return 0
    installed=$(dpkg-query -W -f '${Package} ${db:Status-Status}\n' "$@" 2> /dev/null || true)
    missing=
    for package; do
        case "
$installed
" in
        *"
$package installed
"*) ;;
        *) missing="$missing $package" ;;
        esac
    done
    [ -n "$missing" ] || return 0
    if [ "$(id -u)" -ne 0 ]; then
        echo "Install these packages first: apt-get install$missing" >&2
        exit 1
    fi
    echo "installing$missing ..." >&2
    quietly install apt-get update
    # shellcheck disable=SC2086 # a list of names
    quietly install env DEBIAN_FRONTEND=noninteractive apt-get install -y --no-install-recommends $missing
}

# Runs a command with its output in build/NAME.log, and shows the log only when the command fails.
quietly() {
    log=$root/build/$1.log
    shift
    mkdir -p "$root/build"
    "$@" > "$log" 2>&1 || {
        grep -v "^\[[0-9]*/[0-9]*\] " "$log" >&2 || true # without ninja's progress
        echo "failed: $*" >&2
        exit 1
    }
}

# Brings build/PRESET up to date. Configures only where that was not done before, or was done for a checkout
# that stood elsewhere. One build at a time.
build() {
    mkdir -p "$root/build"
    (
        flock 9
        cd "$root"
        if [ ! -f "build/$1/build.ninja" ] ||
            ! grep -qxF "CMAKE_HOME_DIRECTORY:INTERNAL=$root" "build/$1/CMakeCache.txt"; then
            echo "building build/$1 ..." >&2
            rm -rf "build/$1"
            quietly "$1-configure" cmake --preset "$1"
        fi
        quietly "$1-build" cmake --build --preset "$1"
    ) 9> "$root/build/lock"
}
