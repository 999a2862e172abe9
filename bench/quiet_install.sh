# Sourced by the benchmarks: installs Debian packages without letting them
# start the system's own services (a policy-rc.d that refuses, removed
# afterwards when it was ours).
quiet_install() {
  made_policy=
  if [ ! -e /usr/sbin/policy-rc.d ]; then
    printf '#!/bin/sh\nexit 101\n' > /usr/sbin/policy-rc.d
    chmod +x /usr/sbin/policy-rc.d
    made_policy=1
  fi
  apt-get update -qq
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq "$@" >/dev/null
  [ -z "$made_policy" ] || rm -f /usr/sbin/policy-rc.d
}

# The velmor the benchmark runs: the one named on the command line, with the
# velmorctl beside it, else the harness's default.
use_velmor() {
  if [ -n "$1" ]; then
    export VELMOR_BIN="$1"
    export VELMORCTL_BIN="$(dirname "$1")/velmorctl"
  fi
}

# Dovecot with its server for PROTOCOL (pop3 or imap), installed when missing.
need_dovecot() {
  if ! command -v dovecot >/dev/null 2>&1 || [ ! -x "/usr/lib/dovecot/$1" ]; then
    quiet_install "dovecot-${1}d"
  fi
}
