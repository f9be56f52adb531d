#!/bin/bash
# Builds the release preset and runs the main job: the oxidm command on the
# bundled example configuration.  Installs missing Debian packages first.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
cmake --preset release >/dev/null
cmake --build --preset release -j "$(nproc)" >/dev/null
exec tools/example-session.sh build/release
