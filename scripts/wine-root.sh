#!/usr/bin/env bash
# Builds, once, a 32-bit Debian bookworm root with wine installed in it, in
# which wine-run.sh runs the 32-bit Windows test programs. (wine32 cannot be
# installed beside the host's 64-bit packages, and wine64 alone cannot run
# 32-bit programs.) Quick when the root is already ready.
#
#   wine-root.sh            build the root if it is not ready
#   wine-root.sh --unmount  stop wine and release the mounts inside the root
#   wine-root.sh --remove   unmount, then delete the root
#
# Environment: ISORT_WINE_ROOT (default /var/cache/isort/wine-root),
# ISORT_DEBIAN_MIRROR (default: the host's Debian mirror from its APT sources).
set -euo pipefail
here=$(dirname "$(readlink -f "$0")")
. "$here/wine-common.sh"

# The host's APT settings that decide whether its mirror can be used at all
# (proxy, validity of snapshot indexes), for the root's own APT.
host_apt_conf() {
  apt-config dump 2>/dev/null | grep -E '^Acquire::(https?::Proxy|Check-Valid-Until|Check-Date) ' || true
}

remove_root() {
  wine_unmount_all
  rm -rf --one-file-system "$ISORT_WINE_ROOT"
}

step() { echo "wine-root: $* ($((SECONDS - t0)) s)" >&2; }

build_root() {
  local mirror
  mirror=$(wine_host_mirror)
  t0=$SECONDS
  . "$here/apt-ensure.sh"
  apt_ensure debootstrap
  # A root without the marker is a broken earlier attempt: start over.
  if [ -e "$ISORT_WINE_ROOT" ]; then
    step "removing the incomplete $ISORT_WINE_ROOT"
    remove_root
  fi
  mkdir -p "$ISORT_CACHE"
  step "debootstrap $DEBIAN_SUITE i386 from $mirror"
  # Two stages, so that the host's ability to run the root's programs is
  # settled (natively or through qemu) before any of them runs.
  debootstrap --foreign --arch=i386 --variant=minbase "$DEBIAN_SUITE" "$ISORT_WINE_ROOT" "$mirror" >/dev/null
  wine_ensure_exec
  chroot "$ISORT_WINE_ROOT" /debootstrap/debootstrap --second-stage >/dev/null
  step "debootstrap done"

  printf 'deb %s %s main\ndeb %s %s-updates main\n' "$mirror" "$DEBIAN_SUITE" "$mirror" "$DEBIAN_SUITE" \
    >"$ISORT_WINE_ROOT/etc/apt/sources.list"
  host_apt_conf >"$ISORT_WINE_ROOT/etc/apt/apt.conf.d/90isort-host"
  cp -L /etc/resolv.conf "$ISORT_WINE_ROOT/etc/resolv.conf" 2>/dev/null || true

  wine_mount_proc
  wine_bind /dev "$ISORT_WINE_ROOT/dev"
  wine_in_root DEBIAN_FRONTEND=noninteractive apt-get update -qq
  wine_in_root DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends wine >/dev/null
  wine_in_root apt-get clean
  step "wine installed"

  # Create the prefix now, once, so that concurrent first runs do not race.
  # Its helper processes must not inherit our output (a caller reading it to
  # the end would wait for them).
  wine_in_root mkdir -p "$WINE_PREFIX_IN_ROOT"
  wine_in_root wineboot --init </dev/null >/dev/null 2>&1 || true
  wine_in_root wineserver -w
  wine_in_root test -f "$WINE_PREFIX_IN_ROOT/system.reg" || wine_die "the wine prefix was not created"
  step "wine prefix ready"
  touch "$WINE_READY"
}

wine_need_root
case "${1:-}" in
  --unmount) exec 9>"$WINE_LOCK"; flock 9; [ -d "$ISORT_WINE_ROOT" ] && wine_unmount_all; exit 0 ;;
  --remove)  exec 9>"$WINE_LOCK"; flock 9; [ -e "$ISORT_WINE_ROOT" ] && remove_root; exit 0 ;;
  "") ;;
  *) echo "usage: ${0##*/} [--unmount|--remove]" >&2; exit 2 ;;
esac

[ -e "$WINE_READY" ] && exit 0
mkdir -p "$ISORT_CACHE"
exec 9>"$WINE_LOCK"
flock 9
[ -e "$WINE_READY" ] || build_root
