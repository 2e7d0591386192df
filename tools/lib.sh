# Shared helpers of the project's scripts: which interpreters we build for, and making a
# virtual environment per interpreter with what the build and the tests need.
set -euo pipefail
shopt -s inherit_errexit

ROOT="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
# Several people (or agents) may build side by side: each can name its own folders.
VENVS="${SELVANE_VENVS:-$ROOT/.venvs}"
BUILD_PREFIX="${SELVANE_BUILD_PREFIX:-py}"
PYENV_ROOT="${PYENV_ROOT:-$(pyenv root 2>/dev/null || echo "$HOME/.pyenv")}"
TARGET_VERSIONS=(3.11.7 3.12.1 3.13.0)
DEBUG_PYTHON=/usr/bin/python3.11-dbg

log() { printf '\n=== %s\n' "$*"; }

python_for() {  # version -> interpreter path
  case "$1" in
    dbg) echo "$DEBUG_PYTHON" ;;
    *) echo "$PYENV_ROOT/versions/$1/bin/python" ;;
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
  local tools=("scikit-build-core>=0.8" cmake ninja "pytest>=7" "pexpect>=4.8")
  if [ "$(cat "$venv/.tools-installed" 2>/dev/null)" != "${tools[*]}" ]; then
    "$venv/bin/python" -m pip install -q --disable-pip-version-check "${tools[@]}" >&2 \
      || return 1
    printf '%s' "${tools[*]}" >"$venv/.tools-installed"
  fi
  echo "$venv/bin/python"
}

# Builds and installs the project into an interpreter's venv (incremental build dir).
install_project() {  # name
  local name="$1" vpy
  vpy="$(ensure_venv "$name")"
  "$vpy" -m pip install -q --disable-pip-version-check --no-build-isolation \
    --config-settings=build-dir="build/$BUILD_PREFIX-$name" "$ROOT" >&2 || return 1
  echo "$vpy"
}
