#!/usr/bin/env bash
# help2man for a program that runs only under an emulator:
#   help2man_emulated.sh EMULATOR... -- HELP2MAN-OPTIONS... PROGRAM
# help2man runs PROGRAM --help and --version; here it runs a script of the
# same name that starts PROGRAM under the emulator.
set -euo pipefail
emulator=()
while [ $# -gt 0 ] && [ "$1" != -- ]; do
  emulator+=("$1")
  shift
done
[ $# -ge 2 ] || { echo "usage: $0 EMULATOR... -- HELP2MAN-OPTIONS... PROGRAM" >&2; exit 2; }
shift
options=("${@:1:$#-1}")
program=${!#}
dir=$(mktemp -d)
trap 'rm -rf "$dir"' EXIT
runner="$dir/$(basename "$program")"
{
  printf '#!/usr/bin/env bash\nexec'
  printf ' %q' "${emulator[@]}" "$program"
  printf ' "$@"\n'
} >"$runner"
chmod +x "$runner"
help2man "${options[@]}" "$runner"
