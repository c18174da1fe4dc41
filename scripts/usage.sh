# shellcheck shell=bash
# The scripts source this file first. It answers --help with the header of the script and ends.
[[ ${1-} != --help ]] || exec sed -n '2,/^[^#]/s/^# \?//p' "$0"

# Reports that the script does not know ARGUMENT, and ends it: refuse ARGUMENT
refuse() {
  printf '%s: unknown argument: %s (see %s --help)\n' "${0##*/}" "'$1'" "$0" >&2
  exit 2
}
