# What the scripts of this folder share; they source it.

root=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd -P)
export LC_ALL=C.UTF-8

# A fresh clone may belong to another user than the one who checks it, which git refuses otherwise.
export GIT_CONFIG_COUNT=1 GIT_CONFIG_KEY_0=safe.directory GIT_CONFIG_VALUE_0=$root

die() {
  printf '%s: %s\n' "tools/${0##*/}" "$*" >&2
  exit 2
}

# Prints the usage from the comment at the top of the calling script.
usage() {
  awk 'NR == 1 { next } /^#/ { sub(/^# ?/, ""); print; next } { exit }' "$0"
}

# list_files PATTERN...: the files of the tree in the folder $1 and below that match one of the
# patterns, as paths from its top, each ended by a NUL: what git tracks, and new files that it does
# not ignore. Without git, everything outside build folders.
list_files() {
  local top=$1 found
  shift
  if [[ -e $top/.git ]] && command -v git >/dev/null; then
    git -C "$top" ls-files -z --cached --others --exclude-standard -- "$@" | sort -zu
  else
    local -a match=()
    local pattern
    for pattern in "$@"; do
      match+=(-o -name "$pattern")
    done
    (cd "$top" && find . \( -name build -o -name .git \) -prune -o \
      -type f \( -false "${match[@]}" \) -print0) | sed -z 's,^\./,,' | sort -zu
  fi | while IFS= read -r -d '' found; do
    if [[ -f $top/$found ]]; then
      printf '%s\0' "$found"
    fi
  done
}
