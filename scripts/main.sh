#!/bin/bash
# Builds the release preset and runs the main job: the oxidm command on the
# bundled example configuration.  Installs missing Debian packages first.
# The build's output is kept, and shown when a step fails.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
log=$(mktemp)
trap 'rm -f "$log"' EXIT
step() {
  if ! "$@" >"$log" 2>&1; then
    cat "$log" >&2
    echo "main.sh: failed: $*" >&2
    exit 1
  fi
}
step cmake --preset release
step cmake --build --preset release -j "$(nproc)"
exec tools/example-session.sh build/release
