#!/usr/bin/env bash
# Installs the Debian packages the build needs, when any is missing.
#   scripts/deps.sh        compilers, CMake, GoogleTest, xmllint and bpfmt
#                          (device files check: blueprint-tools is Android.bp's
#                          parser and formatter), and PC/SC: pcscd, its client
#                          library and the vpcd reader driver
#   scripts/deps.sh fuzz   also clang and its runtimes (libFuzzer, sanitizers)
set -euo pipefail
pkgs=(cmake make g++ libgtest-dev libgmock-dev libxml2-utils blueprint-tools pcscd libpcsclite-dev
  vsmartcard-vpcd)
command -v pkg-config >/dev/null || pkgs+=(pkg-config)
if [ "${1:-}" = fuzz ]; then
  pkgs+=(clang libclang-rt-14-dev)
fi
missing=()
for p in "${pkgs[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0
echo "installing: ${missing[*]}" >&2
if [ "$(id -u)" -eq 0 ]; then
  apt-get update -qq
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq "${missing[@]}" >/dev/null
elif command -v sudo >/dev/null; then
  sudo apt-get update -qq
  sudo DEBIAN_FRONTEND=noninteractive apt-get install -y -qq "${missing[@]}" >/dev/null
else
  echo "missing packages: ${missing[*]} (install them with apt-get as root)" >&2
  exit 1
fi
