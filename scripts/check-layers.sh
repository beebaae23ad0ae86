#!/usr/bin/env bash
# Checks that every include in src/ points down the layers (or within its own
# layer): base < platform < model < operations, upcall < code signing, data
# protection, migration < daemon. Layers of one rank never include each
# other. Prints each include that points up or sideways; exits 1 if any.
#   scripts/check-layers.sh [SRC_DIR]
set -euo pipefail
src=${1:-"$(dirname "$0")/../src"}
declare -A rank=([base]=0 [platform]=1 [model]=2 [operations]=3 [upcall]=3
                 [codesigning]=4 [dataprotection]=4 [migration]=4 [daemon]=5)
bad=0
for layer in "${!rank[@]}"; do
  while IFS= read -r hit; do
    file=${hit%%:*}
    target=$(sed -E 's/.*#include "([a-z]+)\/.*/\1/' <<<"$hit")
    [[ -n "${rank[$target]:-}" && "$target" != "$layer" ]] || continue
    if ((rank[$target] >= rank[$layer])); then
      echo "$file includes $target/ (rank ${rank[$target]}) from $layer/ (rank ${rank[$layer]})"
      bad=1
    fi
  done < <(grep -rHE '^#include "[a-z]+/' "$src/$layer" --include='*.h' --include='*.cc' || true)
done
((bad == 0)) && echo "layers: every include points down"
exit "$bad"
