# shellcheck shell=bash
# Each script sources this file first. For --help it prints the header of the script and exits.
[[ ${1-} != --help ]] || exec sed -n '2,/^[^#]/s/^# \?//p' "$0"

# refuse ARGUMENT: reports an unknown argument and exits.
refuse() {
  printf '%s: unknown argument: %s (see %s --help)\n' "${0##*/}" "'$1'" "$0" >&2
  exit 2
}
