# Shared set-up for scripts/test and scripts/run. Source it from the repository root.
# Installs what a fresh Debian 12 machine lacks, configures the cross build and owns the
# build's Wine prefix (build/wineprefix) with a persistent wineserver.

TELVANE_ROOT=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
TELVANE_BUILD=${TELVANE_BUILD:-$TELVANE_ROOT/build}
export WINEPREFIX=${WINEPREFIX:-$TELVANE_BUILD/wineprefix}
export WINEDEBUG=${WINEDEBUG:--all}
# No Mono or Gecko: the prefix must never try to download them.
export WINEDLLOVERRIDES=${WINEDLLOVERRIDES:-mscoree,mshtml=}
export WINEARCH=win64

telvane_log() { printf '[telvane] %s\n' "$*" >&2; }

telvane_as_root() {
  if [ "$(id -u)" = 0 ]; then "$@"; elif command -v sudo >/dev/null 2>&1; then sudo "$@"; else
    telvane_log "need root to run: $*"; return 1; fi
}

# Debian packages the build, the tests, the fuzzers and the benchmarks need.
TELVANE_PACKAGES="wine64 wine g++-mingw-w64-x86-64-posix gcc-mingw-w64-x86-64-posix \
mingw-w64-tools binutils-mingw-w64-x86-64 googletest cmake make clang libclang-rt-14-dev \
rapidjson-dev python3 openssl"

telvane_install_deps() {
  local missing=""
  command -v x86_64-w64-mingw32-g++-posix >/dev/null 2>&1 || missing=1
  command -v wine >/dev/null 2>&1 || missing=1
  command -v wineserver >/dev/null 2>&1 || missing=1
  command -v cmake >/dev/null 2>&1 || missing=1
  command -v clang++ >/dev/null 2>&1 || missing=1
  command -v python3 >/dev/null 2>&1 || missing=1
  command -v openssl >/dev/null 2>&1 || missing=1
  [ -f /usr/src/googletest/CMakeLists.txt ] || missing=1
  [ -f /usr/include/rapidjson/document.h ] || missing=1
  ls /usr/lib/llvm-14/lib/clang/*/lib/linux/libclang_rt.fuzzer-x86_64.a >/dev/null 2>&1 || missing=1
  if [ -n "$missing" ]; then
    telvane_log "installing build dependencies"
    telvane_as_root env DEBIAN_FRONTEND=noninteractive apt-get update -qq
    # shellcheck disable=SC2086
    telvane_as_root env DEBIAN_FRONTEND=noninteractive apt-get install -y -qq \
      --no-install-recommends $TELVANE_PACKAGES >/dev/null
  fi
}

telvane_configure() {
  local type=${1:-RelWithDebInfo}
  cmake -S "$TELVANE_ROOT" -B "$TELVANE_BUILD" \
    -DCMAKE_TOOLCHAIN_FILE="$TELVANE_ROOT/cmake/mingw-w64-x86_64.cmake" \
    -DCMAKE_BUILD_TYPE="$type" -DTELVANE_WERROR=ON \
    -DTELVANE_WINEPREFIX="$WINEPREFIX" >/dev/null
}

telvane_build() {
  cmake --build "$TELVANE_BUILD" -j "$(nproc)" -- --no-print-directory "$@"
}

# Starts (or reuses) the prefix's persistent wineserver and brings the prefix up to date.
# The first Wine call's standard handles are inherited by Wine's background processes,
# so they never point at a shell pipe.
telvane_wine_start() {
  mkdir -p "$WINEPREFIX"
  (wineserver -p </dev/null >/dev/null 2>&1) || true  # already running is fine
  # Plain wineboot: with --init an existing prefix was seen to end up with two services.exe,
  # each with its own service database.
  wine wineboot </dev/null >/dev/null 2>&1 || true
  if [ ! -d "$WINEPREFIX/drive_c/windows" ]; then
    telvane_log "could not create the Wine prefix $WINEPREFIX"
    return 1
  fi
}

# What the phone has and a fresh prefix lacks for the UDP echo test: the policy folder the
# service keeps its policy in, and the test application at the path the service starts.
telvane_install_udptest() {
  local drive="$WINEPREFIX/drive_c"
  if [ ! -f "$TELVANE_BUILD/bin/ZoRiVirOruz.exe" ]; then
    telvane_log "build ZoRiVirOruz.exe first"
    return 1
  fi
  mkdir -p "$drive/data/shareddata/zoriviroruz" "$drive/programs/zoriviroruz"
  cp "$TELVANE_BUILD/bin/ZoRiVirOruz.exe" "$drive/programs/zoriviroruz/ZoRiVirOruz.exe"
}

telvane_wine_stop() {
  WINEPREFIX="$WINEPREFIX" wineserver -k </dev/null >/dev/null 2>&1 || true
}
