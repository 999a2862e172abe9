# Sourced by demo.sh and test.sh: the Debian packages that building and
# testing Velmor need, in one list. Add a package here when a test starts to
# use a new client.
VELMOR_PACKAGES="build-essential cmake ninja-build ccache clang libclang-rt-14-dev googletest libgtest-dev libgmock-dev libssl-dev python3 curl swaks libnet-ssleay-perl openssl fetchmail dovecot-pop3d dnsmasq-base bind9-dnsutils util-linux postfix isync offlineimap3 neomutt tmux"

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
  # Postfix is there for its test tools (smtp-sink, smtp-source): no mail
  # service of its own is set up or started.
  echo "postfix postfix/main_mailer_type select No configuration" | $sudo debconf-set-selections 2>/dev/null || true
  $sudo env DEBIAN_FRONTEND=noninteractive apt-get update -q
  # The tests run servers of their own (a private Dovecot among them): no
  # package may start a system service on their ports.
  made_policy=""
  if [ ! -e /usr/sbin/policy-rc.d ]; then
    printf '#!/bin/sh\nexit 101\n' | $sudo tee /usr/sbin/policy-rc.d >/dev/null
    $sudo chmod 755 /usr/sbin/policy-rc.d
    made_policy=1
  fi
  # shellcheck disable=SC2086
  $sudo env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends $missing
  [ -z "$made_policy" ] || $sudo rm -f /usr/sbin/policy-rc.d
}
