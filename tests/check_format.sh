#!/usr/bin/env bash
# Fails, naming the files, when any C++ source of the project differs from
# what clang-format makes of it under the repository's .clang-format.
set -euo pipefail
clang_format=$1
root=$2
cd "$root"
mapfile -t files < <(find ta platform client tests bench fuzz -type f \( -name '*.cpp' -o -name '*.h' \) 2>/dev/null | sort)
bad=()
for f in "${files[@]}"; do
  if ! "$clang_format" --style=file --dry-run --Werror "$f" >/dev/null 2>&1; then
    bad+=("$f")
  fi
done
if [ ${#bad[@]} -gt 0 ]; then
  echo "not formatted (run: clang-format -i FILE):" >&2
  printf '  %s\n' "${bad[@]}" >&2
  exit 1
fi
echo "${#files[@]} files formatted"
