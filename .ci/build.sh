# Functions that ./serve, ./test and .ci/run share. Read by bash; the reader sets `root` (the top of
# the repository, absolute) and `me` (its own name, for messages).

say() { printf '%s: %s\n' "$me" "$*" >&2; }
die() {
  say "$*"
  exit 1
}

# The packages of the named sections of packages.txt, one a line.
packages_of() {
  awk -v wanted=" $* " '
    /^# section:/ { take = index(wanted, " " $3 " ") > 0; next }
    /^#/ || NF == 0 { next }
    take { print $1 }' "$root/packages.txt"
}

# Those of the given packages that are not installed.
missing_packages() {
  local installed
  installed=$(dpkg-query -W -f='${db:Status-Status} ${Package}\n' "$@" 2>/dev/null |
    awk '$1 == "installed" { print $2 }')
  comm -23 <(printf '%s\n' "$@" | sort -u) <(printf '%s\n' "$installed" | sort -u)
}

# ensure_packages SECTION...: installs what is missing, when root. Without root it names what is
# missing and goes on: a part of the list may not be needed for what is done next.
ensure_packages() {
  local wanted missing
  command -v dpkg-query >/dev/null || {
    say "this is no Debian system; needed are the packages of packages.txt or their like"
    return 0
  }
  mapfile -t wanted < <(packages_of "$@")
  mapfile -t missing < <(missing_packages "${wanted[@]}")
  [ "${#missing[@]}" -eq 0 ] && return 0
  if [ "$(id -u)" -ne 0 ]; then
    say "not installed: ${missing[*]}; as root: apt-get install ${missing[*]}"
    return 0
  fi
  step packages "installing ${missing[*]}" install_packages "${missing[@]}"
}

install_packages() {
  export DEBIAN_FRONTEND=noninteractive
  # A machine that has just started may be installing updates of its own.
  apt-get -q update &&
    apt-get -q -y -o DPkg::Lock::Timeout=600 --no-install-recommends install "$@"
}

# step LOG TEXT COMMAND...: says TEXT, runs the command with its output in build/LOG.log, and ends the
# program with the end of that log and one clear line when it fails.
step() {
  local log=$root/build/$1.log text=$2
  shift 2
  say "$text"
  mkdir -p "$root/build" || die "cannot make $root/build"
  if ! "$@" >"$log" 2>&1 </dev/null; then
    tail -n 40 "$log" >&2
    die "failed: $text; the whole output is in build/${log##*/}"
  fi
}

# configure PRESET: only when there is no build tree for this place, or the presets have changed.
# Everything else that calls for it, the build notices by itself.
configure() {
  local tree=$root/build/$1 fresh=()
  if [ -f "$tree/CMakeCache.txt" ] &&
    ! grep -qxF "CMAKE_HOME_DIRECTORY:INTERNAL=$root" "$tree/CMakeCache.txt"; then
    fresh=(--fresh)  # the repository was moved
  elif [ "$tree/build.ninja" -nt "$root/CMakePresets.json" ]; then
    return 0
  fi
  (cd "$root" && step "configure-$1" "configuring the build ($1)" \
    cmake --preset "$1" "${fresh[@]}") || exit 1
}

# build PRESET [TARGET...]: configures and builds; one run at a time for each preset. What a preset
# writes is its own: its tree, and its logs.
build() {
  local preset=$1 targets=() text="building ($1)"
  shift
  [ $# -gt 0 ] && targets=(--target "$@")
  [ -e "$root/build/$preset/.ninja_log" ] || text+="; the first time takes some minutes"
  mkdir -p "$root/build" || die "cannot make $root/build"
  exec 9>"$root/build/.lock-$preset"
  flock -n 9 || {
    say "waiting for another build of this tree ($preset)"
    flock 9
  }
  configure "$preset"
  up_to_date "$preset" "$@" ||
    step "build-$preset" "$text" \
      cmake --build "$root/build/$preset" "${targets[@]}"
  exec 9>&-
}

up_to_date() {
  local preset=$1
  shift
  ninja -C "$root/build/$preset" -n "$@" 2>/dev/null | grep -q '^ninja: no work to do'
}
