# Sourced by demo.sh and test.sh: the Debian packages that building and
# testing Velmor need, in one list. Add a package here when a test starts to
# use a new client.
VELMOR_PACKAGES="build-essential cmake ninja-build ccache clang libclang-rt-14-dev googletest libgtest-dev libgmock-dev python3 curl swaks fetchmail dnsmasq-base bind9-dnsutils util-linux isync offlineimap3 neomutt tmux"

# Installs whatever in the list is missing (as root, or through sudo).
velmor_install_deps() {
  missing=""
  for package in $VELMOR_PACKAGES; do
    if ! dpkg-query -W -f='${Status}\n' "$package" 2>/dev/null | grep -q "install ok installed"; then
      missing="$missing $package"
    fi
  done
  [ -z "$missing" ] && return 0
  echo "Installing:$missing"
  sudo=""
  [ "$(id -u)" -eq 0 ] || sudo="sudo"
  $sudo env DEBIAN_FRONTEND=noninteractive apt-get update -q
  # shellcheck disable=SC2086
  $sudo env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends $missing
}
