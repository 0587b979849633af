#!/usr/bin/env bash
# Builds when needed and shows the client's help.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
if [ ! -x build/bin/secli ]; then
  cmake -S . -B build >/dev/null
  cmake --build build -j"$(nproc)" >/dev/null
fi
build/bin/secli --help
