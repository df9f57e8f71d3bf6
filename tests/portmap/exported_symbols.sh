#!/bin/bash
# Checks what libzarkportmap.so exports against its public headers: every
# function a header declares is exported, and nothing else is, but for the
# members of the C++ classes a header declares (RouterRuleConf.h).
#
# usage: exported_symbols.sh <libzarkportmap.so> <public include folder>
set -euo pipefail

library=$1
include_dir=$2

# The headers without their comments.
headers=$(sed -e 's://.*$::' -e '/\/\*/,/\*\//d' "$include_dir"/*.h)

# Functions: a declaration at the start of a line, "type name(".
mapfile -t declared < <(grep -oE '^[A-Za-z_][A-Za-z0-9_ *]*[ *][A-Za-z_][A-Za-z0-9_]*\(' \
  <<<"$headers" | grep -vE '^(typedef|static_assert|return)\b' |
  sed -E 's/.*[ *]([A-Za-z_][A-Za-z0-9_]*)\($/\1/' | sort -u)
mapfile -t classes < <(grep -oE '^class [A-Za-z_][A-Za-z0-9_]*' <<<"$headers" |
  sed 's/^class //' | sort -u)

if [ "${#declared[@]}" -eq 0 ]; then
  echo "no function declared in $include_dir" >&2
  exit 1
fi

mapfile -t exported < <(nm -D --defined-only "$library" | awk '{print $NF}' |
  sort -u)
if [ "${#exported[@]}" -eq 0 ]; then
  echo "$library exports nothing" >&2
  exit 1
fi

# Lists as text, searched from here-strings: "printf | grep -q" fails now and
# then under pipefail, when grep stops reading at its first match and printf
# dies of SIGPIPE.
declared_text=$(printf '%s\n' "${declared[@]}")
exported_text=$(printf '%s\n' "${exported[@]}")

failed=0
for symbol in "${exported[@]}"; do
  if grep -qxF "$symbol" <<<"$declared_text"; then
    continue
  fi
  demangled=$(c++filt "$symbol")
  member=0
  for class in "${classes[@]}"; do
    case "$demangled" in
    "$class::"*) member=1 ;;
    esac
  done
  if [ "$member" -eq 0 ]; then
    echo "exported but declared in no public header: $demangled" >&2
    failed=1
  fi
done
for function in "${declared[@]}"; do
  if ! grep -qxF "$function" <<<"$exported_text"; then
    echo "declared but not exported: $function" >&2
    failed=1
  fi
done
for class in "${classes[@]}"; do
  if ! c++filt <<<"$exported_text" | grep "^$class::" >/dev/null; then
    echo "class $class declared but none of its members exported" >&2
    failed=1
  fi
done

echo "${#exported[@]} symbols exported: ${#declared[@]} functions and" \
  "the members of ${#classes[@]} classes declared in $include_dir"
exit "$failed"
