# shellcheck shell=bash disable=SC2034
# Sourced by wine-root.sh and wine-run.sh: where the 32-bit root with wine
# lives, how its 32-bit programs get executed, and how directories are
# mounted into it.
#
# The root is a plain directory tree (default /var/cache/isort/wine-root,
# overridable with ISORT_WINE_ROOT; it must not lie inside a directory that
# gets bind-mounted into it). Mounts inside it (/proc, /dev, the build tree)
# are made once and left in place for later runs; `wine-root.sh --unmount`
# releases them and `wine-root.sh --remove` deletes the root safely.
#
# Some virtual machines cannot execute 32-bit x86 code at all ("Exec format
# error"). There the root's programs run under qemu's user-mode i386
# emulator, registered with the kernel's binfmt_misc for 32-bit x86 ELF files.
# Debian 12's own qemu (7.2) makes wine unusably slow (a wine start-up takes
# minutes); the one from bookworm-backports (10.x) runs a test in about half a
# second, so that one is fetched, unpacked into the cache, not installed.

ISORT_WINE_ROOT=$(realpath -m "${ISORT_WINE_ROOT:-/var/cache/isort/wine-root}")
ISORT_CACHE=$(dirname "$ISORT_WINE_ROOT")
WINE_READY=$ISORT_WINE_ROOT/.isort-wine-ready   # /usr/bin/wine is an absolute symlink: not a readiness test
WINE_LOCK=$ISORT_WINE_ROOT.lock                  # beside the root, so it outlives a rebuild
WINE_PREFIX_IN_ROOT=/var/lib/isort-wine/prefix
WINE_DLL_OVERRIDES='mscoree,mshtml,winemenubuilder.exe=d'
WINE_SERVER_LINGER=${ISORT_WINE_SERVER_LINGER:-60}  # seconds the wine server outlives its last program
QEMU_I386=$ISORT_CACHE/qemu/qemu-i386
BINFMT_DIR=/proc/sys/fs/binfmt_misc
BINFMT_NAME=isort-i386
DEBIAN_SUITE=bookworm

wine_die() { echo "${0##*/}: $*" >&2; exit 2; }

wine_need_root() {
  [ "$(id -u)" = 0 ] || wine_die "must run as root (it uses mount and chroot)"
}

# The host's Debian mirror: the URI of the first APT source carrying the suite.
wine_host_mirror() {
  local uri=
  if [ -n "${ISORT_DEBIAN_MIRROR:-}" ]; then echo "$ISORT_DEBIAN_MIRROR"; return; fi
  if [ -r /etc/apt/sources.list.d/debian.sources ]; then
    uri=$(awk -v s="$DEBIAN_SUITE" 'BEGIN { RS = "" }
      { u = ""; ok = 0
        n = split($0, line, "\n")
        for (i = 1; i <= n; i++) {
          if (line[i] ~ /^URIs:/)   { split(line[i], f, /[ \t]+/); u = f[2] }
          if (line[i] ~ /^Suites:/) { k = split(line[i], f, /[ \t]+/); for (j = 2; j <= k; j++) if (f[j] == s) ok = 1 }
        }
        if (ok && u != "") { print u; exit } }' /etc/apt/sources.list.d/debian.sources)
  fi
  if [ -z "$uri" ] && [ -r /etc/apt/sources.list ]; then
    uri=$(awk -v s="$DEBIAN_SUITE" '$1 == "deb" { i = 2; if ($i ~ /^\[/) { while ($i !~ /\]$/) i++; i++ }
                                                  if ($(i + 1) == s) { print $i; exit } }' /etc/apt/sources.list)
  fi
  echo "${uri:-http://deb.debian.org/debian}"
}

# Fetch qemu's static user-mode emulators from bookworm-backports with a
# private APT state (the host's sources and packages stay as they are) and
# keep qemu-i386 from them.
wine_fetch_qemu() {
  local dir=$ISORT_CACHE/qemu apt keyring=/usr/share/keyrings/debian-archive-keyring.gpg opt=
  [ -r "$keyring" ] && opt="[signed-by=$keyring] "
  rm -rf "$dir/apt" "$dir/unpacked"
  mkdir -p "$dir/apt/lists/partial" "$dir/unpacked"
  echo "deb $opt$(wine_host_mirror) $DEBIAN_SUITE-backports main" >"$dir/apt/sources.list"
  apt=(apt-get -q -o Dir::Etc::sourcelist="$dir/apt/sources.list" -o Dir::Etc::sourceparts=-
       -o Dir::State::Lists="$dir/apt/lists" -o APT::Sandbox::User=root)
  echo "wine: fetching qemu-user from $DEBIAN_SUITE-backports" >&2
  "${apt[@]}" update >/dev/null
  (cd "$dir/apt" && "${apt[@]}" download qemu-user >/dev/null)
  dpkg-deb -x "$dir"/apt/qemu-user_*.deb "$dir/unpacked"
  cp "$dir/unpacked/usr/bin/qemu-i386" "$QEMU_I386.new"
  mv "$QEMU_I386.new" "$QEMU_I386"
  rm -rf "$dir/apt" "$dir/unpacked"
}

wine_binfmt_registered() { [ -e "$BINFMT_DIR/$BINFMT_NAME" ]; }

# Make the root's 32-bit programs executable: natively where the kernel can,
# else through qemu-i386 registered for 32-bit x86 ELF (F: the emulator is
# opened now, so it works inside the chroot). Call with WINE_LOCK held.
wine_ensure_exec() {
  wine_binfmt_registered && return 0
  chroot "$ISORT_WINE_ROOT" /bin/true 2>/dev/null && return 0
  [ -x "$QEMU_I386" ] || wine_fetch_qemu
  [ -e "$BINFMT_DIR/register" ] || mount -t binfmt_misc binfmt_misc "$BINFMT_DIR"
  printf '%s' ":$BINFMT_NAME:M::\\x7fELF\\x01\\x01\\x01\\x00\\x00\\x00\\x00\\x00\\x00\\x00\\x00\\x00\\x02\\x00\\x03\\x00:\\xff\\xff\\xff\\xff\\xff\\xfe\\xfe\\x00\\xff\\xff\\xff\\xff\\xff\\xff\\xff\\xff\\xfe\\xff\\xff\\xff:$QEMU_I386:F" \
    >"$BINFMT_DIR/register"
  echo "wine: 32-bit x86 programs run through $QEMU_I386" >&2
  chroot "$ISORT_WINE_ROOT" /bin/true || wine_die "the root's 32-bit programs do not run, even through qemu"
}

# Mount points at or below DIR, deepest first.
wine_mounts_under() {
  local dir=$1
  awk -v d="$dir" '{ m = $2; gsub(/\\040/, " ", m); if (m == d || index(m, d "/") == 1) print m }' \
    /proc/self/mounts | sort -r -u
}

# wine_bind SRC DST: bind SRC (recursively, without propagating back) at DST
# unless DST already shows SRC (through this or an enclosing bind). A bind
# there that shows another directory is stale: its source was removed and
# made anew at the same path (a fresh clone where an earlier one was), so it
# is replaced. Call with WINE_LOCK held.
wine_bind() {
  local src=$1 dst=$2
  [ "$(stat -c %d:%i "$src")" = "$(stat -c %d:%i "$dst" 2>/dev/null)" ] && return 0
  if mountpoint -q "$dst" 2>/dev/null; then umount -R -l "$dst"; fi
  mkdir -p "$dst"
  mount --rbind "$src" "$dst"
  mount --make-rslave "$dst"
}

wine_mount_proc() {
  local dst=$ISORT_WINE_ROOT/proc
  mountpoint -q "$dst" && return 0
  mkdir -p "$dst"
  mount -t proc proc "$dst"
}

# Run a command inside the root with a clean environment (extra VAR=VALUE
# words may precede the command).
wine_in_root() {
  chroot "$ISORT_WINE_ROOT" env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin HOME=/root LC_ALL=C \
    WINEDEBUG=-all WINEPREFIX="$WINE_PREFIX_IN_ROOT" WINEDLLOVERRIDES="$WINE_DLL_OVERRIDES" "$@"
}

# Stop any wine server of the root, then release every mount inside it.
# Fails if a mount is still busy, so that nothing deletes through it.
wine_unmount_all() {
  local m
  if [ -e "$WINE_READY" ] && mountpoint -q "$ISORT_WINE_ROOT/proc"; then
    wine_in_root wineserver -k 2>/dev/null || true
    wine_in_root wineserver -w 2>/dev/null || true
  fi
  while read -r m; do
    [ -n "$m" ] || continue
    umount -R "$m" 2>/dev/null || true
  done < <(wine_mounts_under "$ISORT_WINE_ROOT")
  if [ -n "$(wine_mounts_under "$ISORT_WINE_ROOT")" ]; then
    echo "still mounted under $ISORT_WINE_ROOT:" >&2
    wine_mounts_under "$ISORT_WINE_ROOT" >&2
    return 1
  fi
}
