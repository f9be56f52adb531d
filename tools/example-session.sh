#!/bin/bash
# A short session with the oxidm command against the bundled example
# configuration (examples/), run as the README's main job:
#   tools/example-session.sh BUILD_DIR
# Each command is shown with its output and exit status; `--root examples`
# makes the command read examples/var/ox/cfg and examples/opt/helvo/cfg in
# place of the live directories, without touching them.
set -uo pipefail
cd "$(dirname "$0")/.."
build=${1:-build/release}
oxidm=$build/tools/oxidm
[[ -x $oxidm ]] || { echo "no $oxidm: build first (cmake --preset release && cmake --build --preset release)" >&2; exit 2; }

run() {
  printf '\n$ oxidm %s\n' "$*"
  "$oxidm" "$@"
  local rc=$?
  printf '[exit %d]\n' "$rc"
  return 0
}

echo "== libox_idm example session (configuration: examples/)"
run --root examples mechanisms
run --root examples map princ alice@EXAMPLE.ORG joe/admin@EXAMPLE.ORG bob@EXAMPLE.ORG mallory@EXAMPLE.ORG eve@OTHER.ORG
run --root examples map host root@node2.example.org ann@NODE1.example.org ci@build.example.org
run --root examples explain princ joe/root@EXAMPLE.ORG
run --root examples groups root
run --root examples cluster any node2 192.0.2.13 unknown.example.org
run --root examples cluster active node1 node3
run --root examples check
run check mapfile examples/mistakes.map
run map princ alice@EXAMPLE.ORG --root examples --json
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
cp -r examples/var "$scratch/"
printf 'princ:!*/root@*\nprinc:bob@EXAMPLE.ORG=robert\n' >"$scratch/new.map"
run --root "$scratch" install global "$scratch/new.map"
run --root "$scratch" --plugin "$build/mpm/liboxmpm_principal.so" map princ bob@EXAMPLE.ORG
run --root examples trace --levels API=1 cluster any node1
