# shellcheck shell=bash
# Sourced by the install scripts: apt_ensure PACKAGE... installs the packages
# that are missing, refreshing the package lists only when they are absent or
# when an install from the current lists fails. Returns at once when every
# package is already installed.

apt_missing() {
  local p
  for p in "$@"; do
    dpkg-query -W -f='${Status}\n' "$p" 2>/dev/null | grep -q '^install ok installed$' || echo "$p"
  done
}

apt_ensure() {
  local missing
  missing=$(apt_missing "$@")
  [ -z "$missing" ] && return 0
  if [ "$(id -u)" != 0 ]; then
    echo "apt_ensure: need root to install: $missing" >&2
    return 1
  fi
  export DEBIAN_FRONTEND=noninteractive
  # A fresh image ships without lists; stale lists fail with 404s on install.
  if ! compgen -G '/var/lib/apt/lists/*_Packages*' >/dev/null; then
    apt-get update -qq
  fi
  # shellcheck disable=SC2086
  if ! apt-get install -y -qq --no-install-recommends $missing; then
    apt-get update -qq
    apt-get install -y -qq --no-install-recommends $missing
  fi
}
