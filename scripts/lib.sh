# What the commands in this folder share; each of them reads it first. From here on the working directory is the root of the
# repository, the first command that fails ends the script, and whatever ends it, `on_exit` has the last word.
# shellcheck shell=bash
set -euo pipefail

caller_dir=$PWD
root=$(cd "$(dirname "$(readlink -f "${BASH_SOURCE[0]}")")/.." && pwd)
cd "$root"
jobs=$(nproc)
logs=build/logs
mkdir -p "$logs"
# The compiler cache must not fail for a home that cannot be written to (a container's user often has none).
[[ -n ${CCACHE_DIR:-} || -w ${HOME:-/nonexistent} ]] || export CCACHE_DIR=$root/build/ccache
# What one clone has compiled serves every other, wherever it lies.
export CCACHE_BASEDIR=$root CCACHE_NOHASHDIR=1
# In front of a compiler that is called by a script.
launcher=()
[[ -z $(command -v ccache) ]] || launcher=(ccache)

# ---- saying what happens ------------------------------------------------------------------------------------------------

say() { echo "==> $*"; }

die() {
  echo "error: $*" >&2
  exit 1
}

takes_nothing() { (($# == 0)) || die "$(basename "$0") takes no arguments"; }

# Runs a command with its output in a log, and shows the end of that log (less the progress lines) if it fails:
# logged NAME COMMAND...
logged() {
  local log=$logs/$1.log
  shift
  "$@" >"$log" 2>&1 </dev/null && return
  local status=$?
  grep -v '^\[[0-9]*/[0-9]*\]' "$log" | tail -n 80
  echo "error: $1 failed with status $status; the whole log is $log" >&2
  return 1
}

# ---- ending -------------------------------------------------------------------------------------------------------------

judged='' cleanups=()

# Has the script end with a verdict: verdict WHAT
verdict() { judged=$*; }

# Has a command run when the script ends: at_exit COMMAND...
at_exit() { cleanups+=("$(printf '%q ' "$@")"); }

on_exit() {
  local status=$? cleanup
  set +e
  for cleanup in "${cleanups[@]}"; do eval "$cleanup"; done
  if [[ -n $judged ]]; then
    if ((status == 0)); then say "PASSED: $judged (${SECONDS} s)"; else say "FAILED: $judged (${SECONDS} s)"; fi
  fi
  exit "$status"
}
trap on_exit EXIT
trap 'exit 130' INT
trap 'exit 143' TERM

# ---- packages -----------------------------------------------------------------------------------------------------------

build_packages=(g++ cmake ninja-build ccache git libsqlite3-dev zlib1g-dev libgoogle-glog-dev nlohmann-json3-dev
  libgtest-dev libgmock-dev libcli11-dev libjs-chart.js sqlite3)

# Prints those of the named packages that are not installed.
missing_packages() {
  comm -13 <(dpkg-query -W -f '${db:Status-Status} ${Package}\n' "$@" 2>/dev/null | sed -n 's/^installed //p' | sort -u) \
    <(printf '%s\n' "$@" | sort -u)
}

as_root() { if ((EUID == 0)); then "$@"; else sudo "$@"; fi; }

# Without a terminal nobody could type a password.
can_be_root() { ((EUID == 0)) || { command -v sudo >/dev/null && { [[ -t 0 ]] || sudo -n true 2>/dev/null; }; }; }

# Makes sure that the named packages are installed. Quick and offline when they are.
need() {
  [[ -z ${CELLAR_SKIP_PACKAGES:-} ]] || return 0
  command -v apt-get >/dev/null ||
    die "this needs Debian or Ubuntu; elsewhere install the counterparts of: $* and set CELLAR_SKIP_PACKAGES=1"
  local missing
  mapfile -t missing < <(missing_packages "$@")
  ((${#missing[@]} > 0)) || return 0

  if ! can_be_root; then
    {
      echo "Missing packages: ${missing[*]}"
      echo "Install them, then try again:"
      echo "  apt-get update && apt-get install --no-install-recommends ${missing[*]}"
    } >&2
    die "packages are missing, and they cannot be installed without root or sudo"
  fi

  say "Installing ${missing[*]}"
  local apt=(as_root env DEBIAN_FRONTEND=noninteractive apt-get -y -o Acquire::Retries=3 -o DPkg::Lock::Timeout=300)
  # Old lists may do just as well, so a failure here decides nothing yet.
  logged apt-update "${apt[@]}" update || say "The package lists could not be refreshed; trying with the old ones"
  logged apt-install "${apt[@]}" install --no-install-recommends "${missing[@]}" ||
    die "could not install: ${missing[*]}"
}

# clang++ with the runtime of sanitizers, the package of which depends on its version: need_clang_with SANITIZERS, as
# -fsanitize= takes them.
need_clang_with() {
  need "${build_packages[@]}" clang
  local version
  version=$(clang++ -dumpversion)
  links_with "$1" || need "libclang-rt-${version%%.*}-dev"
  links_with "$1" || die "clang++ $version cannot link with -fsanitize=$1"
}

links_with() {
  echo 'extern "C" int LLVMFuzzerTestOneInput(const unsigned char*, unsigned long) { return 0; }' >build/sanitized.cpp
  [[ $1 == *fuzzer* ]] || echo 'int main() {}' >>build/sanitized.cpp
  clang++ "-fsanitize=$1" build/sanitized.cpp -o build/sanitized 2>/dev/null
}

# The cross compiler, and the libraries for ARM that it links: need_arm, or need_arm 64. Quick and offline when they are there.
need_arm() {
  local compiler=g++-arm-linux-gnueabihf architecture=armhf
  [[ ${1:-} != 64 ]] || compiler=g++-aarch64-linux-gnu architecture=arm64
  need "$compiler" qemu-user-static cmake ninja-build ccache git libjs-chart.js
  logged "arm${1:-}-sysroot" bash scripts/arm-sysroot "build/arm${1:-}-sysroot" "$architecture" ||
    die "the libraries for $architecture could not be fetched"
}

# ---- building and testing -----------------------------------------------------------------------------------------------

# Configures the tree of a preset when that has not been done, or when the presets or the place of the sources changed.
configure() {
  local preset=$1 tree=build/$1
  local home
  home=$(sed -n 's/^CMAKE_HOME_DIRECTORY:INTERNAL=//p' "$tree/CMakeCache.txt" 2>/dev/null || true)
  if [[ -n $home && $home != "$root" ]]; then
    rm -rf "$tree/CMakeCache.txt" "$tree/CMakeFiles"
  elif [[ -e $tree/build.ninja && ! CMakePresets.json -nt $tree/build.ninja ]]; then
    return 0
  fi
  say "Configuring $tree"
  logged "$preset-configure" cmake --preset "$preset" || return 1
  touch "$tree/build.ninja"
}

# Brings a tree up to date: build PRESET [TARGET...]
build() {
  local preset=$1
  shift
  configure "$preset" || return 1
  say "Building build/$preset"
  logged "$preset-build" ninja -C "build/$preset" -j "$jobs" "$@"
}

# What failed in a log of ctest, with its output, but without that of a program's tests that passed.
failures_of() {
  sed '/% tests passed/q; /^ *Start /d; / Passed /d; /^\[----------\]/d; /^$/d' "$1" | awk '
    function flush() { if (held != "") print held; held = "" }
    /^\[ RUN      \]/ { flush(); held = $0; next }
    /^\[       OK \]/ { held = ""; next }
    /^\[  FAILED  \]/ || /^ *[0-9]+\/[0-9]+ Test / { flush() }
    held != "" { held = held "\n" $0; next }
    { print }
    END { flush() }'
}

# Runs the tests of a tree. Prints what failed with its output, and the numbers always. The test programs run in parts, which
# ctest counts as one test each; what their tests are is what the programs say.
# run_tests PRESET [CTEST_OPTION...]
run_tests() {
  local preset=$1 log=$logs/$1-tests.log status=0
  shift
  say "Testing build/$preset"
  ctest --preset "$preset" --output-on-failure --no-tests=error --timeout 300 -j "$jobs" "$@" >"$log" 2>&1 </dev/null || status=$?
  if ((status != 0)); then
    failures_of "$log" | { head -n 400 && cat >/dev/null; }
  fi
  sed -n '/% tests passed/,$p' "$log"
  awk '/^\[==========\] [0-9]+ tests? from .* ran\./ { ran += $2 }
    /^\[  PASSED  \] [0-9]+ test/ { passed += $4 }
    /^\[  SKIPPED \] .* \(/ { print "skipped: " $0; skipped++ }
    END { printf "In these, the test programs ran %d tests: %d passed, %d skipped\n", ran, passed, skipped }' \
    "build/$preset/Testing/Temporary/LastTest.log"
  return "$status"
}
