# Shared helpers of the project's scripts: which interpreters we build for, and making a
# virtual environment per interpreter with what the build and the tests need.
set -euo pipefail
shopt -s inherit_errexit

ROOT="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
# Several people (or agents) may build side by side: each can name its own folders.
VENVS="${SELVANE_VENVS:-$ROOT/.venvs}"
BUILD_DIR="${SELVANE_BUILD_DIR:-$ROOT/build}"
BUILD_PREFIX="${SELVANE_BUILD_PREFIX:-py}"
PYENV_ROOT="${PYENV_ROOT:-$(pyenv root 2>/dev/null || echo "$HOME/.pyenv")}"
# Release interpreters on this machine (pyenv builds) and its debug interpreter (Debian's).
TARGET_VERSIONS=(3.11.7 3.12.1 3.13.0)
DEBUG_PYTHON=/usr/bin/python3.11-dbg
# Newer interpreters come from Debian unstable, whose binaries need a newer C library than
# this machine's: they run in a Debian unstable root (see ensure_unstable_root), release
# builds as /usr/bin/python3.X, debug builds as /usr/bin/python3.Xd.
ROOT_RELEASE_VERSIONS=(3.14 3.15)
ROOT_DEBUG_VERSIONS=(3.13 3.14 3.15)

log() { printf '\n=== %s\n' "$*"; }

has_monitoring() {  # name -> whether that interpreter has sys.monitoring (3.12 and later)
  local minor
  case "$1" in
    dbg) return 1 ;;  # Debian 12's python3.11-dbg
    3.*) minor="${1#3.}"; minor="${minor%%.*}"; minor="${minor%d}"; ((minor >= 12)) ;;
    *) return 1 ;;
  esac
}

python_for() {  # name -> interpreter path
  case "$1" in
    dbg) echo "$DEBUG_PYTHON" ;;
    *.*.*) echo "$PYENV_ROOT/versions/$1/bin/python" ;;
    # Debian's names, inside the unstable root: 3.14 is the release build, 3.14d the debug one.
    *) echo "/usr/bin/python$1" ;;
  esac
}

# Debian packages the tests need: the debug interpreter (with its headers) and GoogleTest.
ensure_machine_packages() {
  local wanted=(python3.11-dbg libpython3.11-dbg python3.11-venv libgtest-dev) missing=()
  for pkg in "${wanted[@]}"; do
    dpkg -s "$pkg" >/dev/null 2>&1 || missing+=("$pkg")
  done
  if ((${#missing[@]})); then
    log "installing ${missing[*]}"
    local sudo=""
    [ "$(id -u)" = 0 ] || sudo="sudo"
    $sudo apt-get update -qq
    DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq "${missing[@]}" >/dev/null
  fi
}

# Runs pip (its arguments), leaving out its notes about configured local package folders that
# do not exist where it runs (a machine's configuration may name folders it does not have).
pip_quietly() {  # python pip-args...
  local python="$1"
  shift
  { "$python" -m pip "$@" 2>&1 1>&3 3>&- | sed -E "/^WARNING: Location '.*' is ignored/d" >&2; } 3>&1
}

# Makes (once) the virtual environment for an interpreter, with the build and test tools.
ensure_venv() {  # name -> path of the venv's python (in $SELVANE_VENVS if set now)
  local name="$1" python venv
  python="$(python_for "$name")"
  venv="${SELVANE_VENVS:-$VENVS}/$name"
  if [ ! -x "$venv/bin/python" ]; then
    "$python" -m venv "$venv" >&2
  fi
  # The marker holds the list installed, so that a venv made before a tool joined the list
  # gets it on the next run.
  local tools=("scikit-build-core>=0.8" cmake ninja "pytest>=7" "pexpect>=4.8" "coverage>=7.4")
  if [ "$(cat "$venv/.tools-installed" 2>/dev/null)" != "${tools[*]}" ]; then
    pip_quietly "$venv/bin/python" install -q --disable-pip-version-check "${tools[@]}" >&2 \
      || return 1
    printf '%s' "${tools[*]}" >"$venv/.tools-installed"
  fi
  echo "$venv/bin/python"
}

# Builds and installs the project into an interpreter's venv (incremental build dir).
install_project() {  # name
  local name="$1" vpy
  vpy="$(ensure_venv "$name")"
  pip_quietly "$vpy" install -q --disable-pip-version-check --no-build-isolation \
    --config-settings=build-dir="$BUILD_DIR/$BUILD_PREFIX-$name" "$ROOT" >&2 || return 1
  echo "$vpy"
}

# ---- The Debian unstable root ------------------------------------------------------------
#
# A directory tree made with mmdebstrap from the Debian mirror that this machine's apt sources
# name, kept in a cache folder outside every checkout and shared by them. It is reused while
# it is complete and made again when it is missing or broken. Each checkout gets its own
# workspace inside it (a copy of the checkout, venvs and build folders), so nothing made
# there ever lands in the checkout, and nothing in the checkout knows where the root is.

UNSTABLE_ROOT="${SELVANE_UNSTABLE_ROOT:-${XDG_CACHE_HOME:-$HOME/.cache}/selvane/debian-unstable}"
# Written last when the root is made; its content is the recipe the root was made from, so a
# changed recipe makes a new root.
ROOT_STAMP=.selvane-root-recipe

root_packages() {
  local v pkgs=(ca-certificates g++ cmake make valgrind libgtest-dev)
  for v in 3.13 3.14 3.15; do pkgs+=("python$v-dev" "python$v-dbg" "python$v-venv"); done
  echo "${pkgs[*]}"
}

# The Debian archive this machine's apt sources use for its own release: the URI of the first
# entry (one-line or deb822 format) whose suites include the release's code name exactly.
debian_mirror() {
  local codename
  codename="$(. /etc/os-release && echo "${VERSION_CODENAME:-}")"
  [ -n "$codename" ] || { echo "no VERSION_CODENAME in /etc/os-release" >&2; return 1; }
  local files=() f
  for f in /etc/apt/sources.list /etc/apt/sources.list.d/*.list /etc/apt/sources.list.d/*.sources; do
    [ -f "$f" ] && files+=("$f")
  done
  ((${#files[@]})) || { echo "no apt sources on this machine" >&2; return 1; }
  awk -v want="$codename" '
    function suite_matches(list,   n, i, parts) {
      n = split(list, parts, /[ \t]+/)
      for (i = 1; i <= n; i++) if (parts[i] == want) return 1
      return 0
    }
    function flush() {
      if (types ~ /(^|[ \t])deb([ \t]|$)/ && suite_matches(suites) && uris != "") {
        split(uris, u, /[ \t]+/); print u[1]; found = 1; exit
      }
      types = ""; uris = ""; suites = ""
    }
    FNR == 1 { flush() }
    /^[ \t]*#/ { next }
    /^deb[ \t]/ {              # one-line format: deb [options] uri suite components...
      line = $0; sub(/\[[^]]*\]/, "", line); n = split(line, w, /[ \t]+/)
      if (w[3] == want) { print w[2]; found = 1; exit }
      next
    }
    /^[ \t]*$/ { flush(); next }
    /^Types:/  { sub(/^Types:[ \t]*/, ""); types = $0; next }
    /^URIs:/   { sub(/^URIs:[ \t]*/, ""); uris = $0; next }
    /^Suites:/ { sub(/^Suites:[ \t]*/, ""); suites = $0; next }
    END { if (!found) flush() }
  ' "${files[@]}"
}

root_is_complete() {
  local root="$1" v
  [ -f "$root/$ROOT_STAMP" ] && [ "$(cat "$root/$ROOT_STAMP")" = "$(root_packages)" ] || return 1
  for v in "${ROOT_RELEASE_VERSIONS[@]}" "${ROOT_DEBUG_VERSIONS[@]/%/d}"; do
    [ -x "$root/usr/bin/python$v" ] || return 1
  done
  for f in usr/bin/g++ usr/bin/cmake usr/include/gtest/gtest.h; do [ -e "$root/$f" ] || return 1; done
  chroot "$root" /usr/bin/python3.15 -c "import venv, ssl" >/dev/null 2>&1
}

# Runs as root: directly when we are, else through sudo (chroot and mounts need it).
as_root() {
  if [ "$(id -u)" = 0 ]; then "$@"; else sudo "$@"; fi
}

root_fail() {  # reason: kept in ROOT_FAILURE for the caller's report; the caller returns 1
  ROOT_FAILURE="$1"
  echo "$1" >&2
}

# Makes the root unless a complete one is there. On failure says why (also in ROOT_FAILURE)
# and returns non-zero: the newer interpreters are never left out silently.
ensure_unstable_root() {
  local root="$UNSTABLE_ROOT"
  if root_is_complete "$root"; then return 0; fi
  log "making the Debian unstable root in $root (interpreters 3.13 to 3.15, compilers)"
  if ! command -v mmdebstrap >/dev/null; then
    as_root apt-get update -qq && DEBIAN_FRONTEND=noninteractive as_root apt-get install -y -qq mmdebstrap >/dev/null \
      || { root_fail "cannot install mmdebstrap"; return 1; }
  fi
  local mirror
  mirror="$(debian_mirror)" && [ -n "$mirror" ] \
    || { root_fail "no Debian mirror found in this machine's apt sources"; return 1; }
  # Anything mounted below the old tree would be removed with it: mounts are only ever made
  # in private namespaces (in_root), so finding one means something else is using the tree.
  if [ -d "$root" ] && findmnt -rn -o TARGET | grep -q "^$root/"; then
    root_fail "something is mounted inside $root; not replacing it"; return 1
  fi
  as_root rm -rf "$root" "$root.partial"
  mkdir -p "$(dirname "$root")"
  # The mirror's Release file for unstable may be older than the validity window it states.
  local packages
  packages="$(root_packages)"
  if ! as_root mmdebstrap --mode=root --variant=minbase --quiet \
      --aptopt='Acquire::Check-Valid-Until "false"' --include="${packages// /,}" \
      unstable "$root.partial" "$mirror" >&2; then
    as_root rm -rf "$root.partial"
    root_fail "mmdebstrap could not make the Debian unstable root from $mirror"
    return 1
  fi
  echo "$packages" | as_root tee "$root.partial/$ROOT_STAMP" >/dev/null
  as_root mv "$root.partial" "$root"
  root_is_complete "$root" || { root_fail "the new root in $root does not work"; return 1; }
}

# pip inside the root: its own configuration, written from this machine's settings.
#
# Two ways were possible: copy the machine's pip configuration files and every local file or
# folder they (or the PIP_* variables) name, or give the root's pip a configuration of its
# own. The second is taken: a configuration can name anything local (constraints,
# requirements, find-links folders, file:// indexes, several GB on some machines), and its
# owner changes it at will, so copying would chase every new kind of setting. The root's pip
# gets only what reaching the package index takes (index URLs, trusted hosts, proxy,
# time-outs, and the certificate bundles, copied into the root); tools/root_pip_conf.py
# reads the machine's settings through pip itself and writes it. in_root runs every command
# with PIP_CONFIG_FILE naming it and without this machine's PIP_* variables; configuration
# files left in the root by older versions of this script are removed, since pip would
# still read them.
ROOT_PIP_DIR=/etc/selvane/pip

write_root_pip_config() {  # dir-in-root: writes DIR/pip.conf (and certificates) in the root
  local dir="$1" python
  python="$(python_for "${TARGET_VERSIONS[0]}")"
  [ -x "$python" ] || python=python3
  as_root "$python" "$ROOT/tools/root_pip_conf.py" "$UNSTABLE_ROOT$dir" "$dir"
}

write_root_settings() {
  local root="$UNSTABLE_ROOT" f
  for f in /etc/resolv.conf /etc/hosts; do
    [ -f "$f" ] && as_root cp -L "$f" "$root$f"
  done
  as_root rm -rf "$root/etc/pip.conf" "$root/etc/xdg/pip" "$root/root/.pip" \
    "$root/root/.config/pip"
  write_root_pip_config "$ROOT_PIP_DIR"
}

# Runs a command inside the root, in a mount namespace of its own: /proc, /dev and a fresh
# /tmp are mounted there and vanish with the command, whatever way it ends. The environment
# keeps this machine's variables with a plain PATH, except pip's: the root's pip reads only
# the configuration written for it (write_root_settings).
in_root() {
  local drop=() v
  for v in $(compgen -e); do
    case "$v" in PIP_* | XDG_CONFIG_*) drop+=(-u "$v") ;; esac
  done
  # pip (from 24.2) verifies the index's certificate through the system's trust store, that
  # is OpenSSL's default bundle (SSL_CERT_FILE), not through its own `cert` setting: where
  # this machine reaches the index through an authority of its own, the root must trust the
  # bundle copied for pip as well.
  local trust=()
  if [ -f "$UNSTABLE_ROOT$ROOT_PIP_DIR/cert.pem" ]; then
    trust=(SSL_CERT_FILE="$ROOT_PIP_DIR/cert.pem" REQUESTS_CA_BUNDLE="$ROOT_PIP_DIR/cert.pem")
  fi
  as_root unshare --mount --propagation private -- /bin/sh -c '
    root="$1"; shift
    mount -t proc proc "$root/proc" && mount --rbind /dev "$root/dev" &&
      mount -t tmpfs tmpfs "$root/tmp" || exit 1
    exec chroot "$root" /usr/bin/env "$@"
  ' in_root "$UNSTABLE_ROOT" "${drop[@]}" \
    PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin \
    PIP_CONFIG_FILE="$ROOT_PIP_DIR/pip.conf" "${trust[@]}" "$@"
}

# This checkout's workspace inside the root (a path as seen from inside it), one per
# checkout so that two checkouts on one machine never share venvs or builds.
root_workspace() {
  echo "/srv/selvane/$(printf '%s' "$ROOT" | sha256sum | cut -c1-16)"
}

# Copies the checkout's files (tracked, and new files git does not ignore) into the
# workspace, replacing the previous copy; modification times are kept, so builds there stay
# incremental.
copy_checkout_into_root() {
  local dest
  dest="$UNSTABLE_ROOT$(root_workspace)/src"
  as_root rm -rf "$dest"
  as_root mkdir -p "$dest"
  if git -C "$ROOT" rev-parse --is-inside-work-tree >/dev/null 2>&1; then
    (cd "$ROOT" && git ls-files -z --cached --others --exclude-standard \
      | while IFS= read -r -d '' f; do [ -e "$f" ] && printf '%s\0' "$f"; done \
      | tar --null -T - -cf -) | as_root tar -xf - -C "$dest"
  else
    (cd "$ROOT" && tar --exclude=./build --exclude='./.venvs*' -cf - .) | as_root tar -xf - -C "$dest"
  fi
}
