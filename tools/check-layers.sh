#!/usr/bin/env bash
# Checks the library's layering: a unit under Utility/rndctl/ includes only
# headers of its own folder or of the folders below it, and no library
# source includes the umbrella header rndctl.h (it is for editors and tools).
# Exit 0 when the layering holds; otherwise each offending include is named.
set -euo pipefail
root=${1:-$(cd "$(dirname "$0")/.." && pwd)}
order=(base proc ctldir records ctlfile tasks)
rank() {
  local i
  for i in "${!order[@]}"; do [ "${order[$i]}" = "$1" ] && { echo "$i"; return; }; done
  echo -1
}
bad=0
for dir in "${order[@]}"; do
  mine=$(rank "$dir")
  for f in "$root/Utility/rndctl/$dir"/*; do
    [ -f "$f" ] || continue
    while IFS= read -r inc; do
      if [ "$inc" = "rndctl.h" ]; then
        echo "${f#$root/} includes the umbrella rndctl.h"; bad=1; continue
      fi
      theirs=$(rank "${inc%%/*}")
      if [ "$theirs" -gt "$mine" ]; then
        echo "${f#$root/} includes $inc from a unit above it"; bad=1
      fi
    done < <(sed -n 's|^#include "Utility/rndctl/\([^"]*\)".*|\1|p' "$f")
  done
done
exit $bad
