# Bare Debian roots, for scripts to source: bare_root, install_packages, copy_sources.

roots=${HEFT_ROOTS:-/var/tmp/heft-roots}
takes_expired=${takes_expired:-}
build_packages=(g++ cmake ninja-build pkg-config libbsd-dev libgtest-dev nlohmann-json3-dev jq python3 python3-jsonschema mandoc)

[ "$(id -u)" -eq 0 ] || { echo "$0: needs root" >&2; exit 1; }
command -v mmdebstrap >/dev/null || { echo "$0: the package mmdebstrap is missing" >&2; exit 1; }
mkdir -p "$roots"

# The mirror that this machine's own packages come from.
mirror() {
    apt-get indextargets --format '$(SITE) $(ORIGIN) $(LABEL)' 'Created-By: Packages' | awk '$2 == "Debian" && $3 == "Debian" { print $1; exit }'
}

# Prints the folder of a root of the release `suite`, which is made if it is not there; fails when it is not to be had. With a second
# word it is another root, of that name.
bare_root() {
    local suite=$1 root=$roots/$1${2:+-$2} options=()
    if [ -n "$takes_expired" ]; then options=(--aptopt='Acquire::Check-Valid-Until "false"'); fi
    if [ ! -e "$root/etc/debian_version" ]; then
        rm -rf "$root"
        mmdebstrap --variant=apt "${options[@]}" "$suite" "$root" "$(mirror)" >"$root.log" 2>&1 || {
            echo "$suite: $(grep -m 1 '^E:' "$root.log")" >&2
            rm -rf "$root"
            return 1
        }
        chroot "$root" apt-get -q update >>"$root.log" 2>&1
    fi
    echo "$root"
}

# Installs packages in a root.
install_packages() {
    local root=$1
    shift
    DEBIAN_FRONTEND=noninteractive chroot "$root" apt-get -q install -y --no-install-recommends "$@"
}

# Copies the sources as they stand (not what git ignores) to a folder, where only what was built before stays.
copy_sources() {
    mkdir -p "$1"
    find "$1" -mindepth 1 -maxdepth 1 ! -name build -exec rm -rf {} +
    git ls-files --cached --others --exclude-standard -z | tar --null --ignore-failed-read -T - -cf - | tar -C "$1" --no-same-owner -xf -
}
