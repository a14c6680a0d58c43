#!/usr/bin/env bash
# Installs every Debian package the project needs to build, test and run.
# Safe to run any number of times; does nothing when everything is present.
set -euo pipefail

packages=(
  build-essential cmake pkg-config
  libssl-dev openssl
  libjsoncpp-dev
  libcpp-httplib-dev
  libgtest-dev
  p7zip-full
  lego pebble
  iproute2
  curl wrk
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi

sudo_cmd=()
if [ "$(id -u)" -ne 0 ]; then
  sudo_cmd=(sudo)
fi
export DEBIAN_FRONTEND=noninteractive
"${sudo_cmd[@]}" apt-get update -qq
"${sudo_cmd[@]}" apt-get install -y -qq --no-install-recommends "${missing[@]}"
