#!/usr/bin/env bash
# Installs the Debian packages the build, the tests and the demo need, if any
# is missing, plus any packages named as arguments. Needs root (or sudo) only
# when something has to be installed.
#
#   bash scripts/install-deps.sh [extra-package ...]
set -euo pipefail

packages=(build-essential cmake ninja-build pkg-config binutils libjsoncpp-dev libgtest-dev
          libgmock-dev libbenchmark-dev libcpp-httplib-dev libcli11-dev iproute2 "$@")
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "installing: ${missing[*]}"
  sudo_cmd=()
  if [ "$(id -u)" -ne 0 ]; then
    if ! command -v sudo >/dev/null; then
      echo "install-deps: missing packages (${missing[*]}); run as root or install them" >&2
      exit 1
    fi
    sudo_cmd=(sudo)
  fi
  "${sudo_cmd[@]}" env DEBIAN_FRONTEND=noninteractive apt-get update -qq
  "${sudo_cmd[@]}" env DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi
