# Shared pieces of bench/compare and bench/scaling (sourced, not run).

log() { printf '[%s] %s\n' "$(date -u +%H:%M:%S)" "$*" >&2; }

# ensure_tools PROGRAM:PACKAGE...: installs the Debian packages of the
# programs that are missing.
ensure_tools() {
  local missing=() pair
  for pair in "$@"; do
    command -v "${pair%%:*}" >/dev/null 2>&1 || missing+=("${pair#*:}")
  done
  [[ ${#missing[@]} -eq 0 ]] && return 0
  log "installing ${missing[*]}"
  if [[ $(id -u) -eq 0 ]]; then
    apt-get install -y "${missing[@]}" >/dev/null || { apt-get update >/dev/null && apt-get install -y "${missing[@]}" >/dev/null; }
  else
    sudo apt-get install -y "${missing[@]}" >/dev/null
  fi
}

# build_bench 0|1: builds the bench preset (Release, no tests) unless 0;
# sets bindir and stowline.
build_bench() {
  if [[ $1 == 1 ]]; then
    log "building the bench preset"
    (cd "$source_dir" && cmake --preset bench >/dev/null && cmake --build --preset bench -j2 >/dev/null)
  fi
  bindir=$source_dir/build/bench
  stowline=$bindir/tools/stowline
  local program
  for program in "$stowline" "$bindir/bench/sl-filelayer" "$bindir/bench/sl-floor"; do
    [[ -x $program ]] || { echo "missing $program: build the bench preset first" >&2; exit 1; }
  done
}

# make_scratch DIR...: makes each scratch directory, refusing one that
# already holds something (it is removed at the end).
make_scratch() {
  local dir
  for dir in "$@"; do
    if [[ -e $dir ]] && [[ -n $(ls -A "$dir" 2>/dev/null) ]]; then
      echo "scratch directory $dir is not empty; remove it or name another" >&2
      exit 1
    fi
    mkdir -p "$dir"
  done
}

# One "machine=..." description for the results.
machine_meta() {
  local cpu cores mem fs
  cpu=$(sed -n 's/^model name[[:space:]]*: //p' /proc/cpuinfo | head -1)
  cores=$(nproc)
  mem=$(awk '/MemTotal/ {printf "%.0f GiB", $2 / 1048576}' /proc/meminfo)
  fs=$(findmnt -n -o FSTYPE,OPTIONS --target "$scratch" 2>/dev/null | head -1 | tr -s ' ' ' ')
  printf 'machine=%s; %s cores; %s RAM; kernel %s; scratch on %s' "$cpu" "$cores" "$mem" "$(uname -r)" "$fs"
}

# run_round_each CASE ROUND NAME PREPARE COMMAND [NAME PREPARE COMMAND...]:
# one hyperfine over the commands, $RUNS runs each (default 1; the round's
# value of a command is the median of its runs), each run after its own
# PREPARE (empty for none), in an order rotated by ROUND. The export goes to
# $raw/CASE-ROUND.json and one line of timings is printed.
run_round_each() {
  local case=$1 round=$2
  shift 2
  local names=() prepares=() commands=()
  while [[ $# -gt 0 ]]; do names+=("$1"); prepares+=("$2"); commands+=("$3"); shift 3; done
  local n=${#names[@]} args=() preps=() any=0 i k
  for ((i = 0; i < n; i++)); do [[ -n ${prepares[i]} ]] && any=1; done
  for ((i = 0; i < n; i++)); do
    k=$(( (i + round) % n ))
    args+=(-n "${names[k]}" "${commands[k]}")
    [[ $any == 1 ]] && preps+=(--prepare "${prepares[k]:-true}")
  done
  # hyperfine's advice on noise goes to its log; a failure shows it.
  if ! hyperfine -N --runs "${RUNS:-1}" --style none "${preps[@]}" --export-json "$raw/$case-$round.json" \
      "${args[@]}" >/dev/null 2>"$raw/$case-$round.log"; then
    cat "$raw/$case-$round.log" >&2
    return 1
  fi
  python3 "$here/summarize.py" --show-round "$raw/$case-$round.json"
}

# run_round CASE ROUND PREPARE NAME COMMAND [NAME COMMAND...]: the same,
# with one PREPARE (or none) before every command.
run_round() {
  local case=$1 round=$2 prepare=$3 triples=()
  shift 3
  while [[ $# -gt 0 ]]; do triples+=("$1" "$prepare" "$2"); shift 2; done
  run_round_each "$case" "$round" "${triples[@]}"
}

# remove_tree PATH...: removes scratch trees, untimed. On a disk mounted
# with discard, the layer's removal is much faster than rm -rf here, so
# preparation and cleanup use it (rm -rf when it is not built yet).
remove_tree() {
  local path
  for path in "$@"; do
    [[ -e $path || -L $path ]] || continue
    if [[ -x ${bindir:-}/bench/sl-filelayer ]]; then
      "$bindir/bench/sl-filelayer" remove "$path" || rm -rf "$path"
    else
      rm -rf "$path"
    fi
  done
}
