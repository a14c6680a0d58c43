#!/usr/bin/env bash
# Installs every Debian package the project needs to build, test and run.
# Safe to run any number of times; does nothing when everything is present.
set -euo pipefail

packages=(
  build-essential cmake pkg-config
  clang libclang-rt-dev
  libssl-dev openssl
  libjsoncpp-dev
  libcpp-httplib-dev
  libgtest-dev
  p7zip-full
  lego pebble
  iproute2
  curl wrk
  nginx
  gcovr
  chromium nodejs
)
# The machine's Node.js may come with its own npm; Debian's is a package of its own.
command -v npm >/dev/null 2>&1 || packages+=(npm)

# playwright-core and axe-core for the page's browser test, from the lock
# file; playwright drives the chromium above and never downloads a browser
# of its own, axe-core is injected into the page from the disk.
install_web_test_modules() {
  local dir
  dir="$(cd "$(dirname "$0")/.." && pwd)/web/test"
  if [ ! -f "$dir/node_modules/playwright-core/package.json" ] ||
     [ ! -f "$dir/node_modules/axe-core/axe.min.js" ]; then
    (cd "$dir" && PLAYWRIGHT_SKIP_BROWSER_DOWNLOAD=1 npm ci --no-audit --no-fund --silent)
  fi
}

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  install_web_test_modules
  exit 0
fi

sudo_cmd=()
if [ "$(id -u)" -ne 0 ]; then
  sudo_cmd=(sudo)
fi
export DEBIAN_FRONTEND=noninteractive
"${sudo_cmd[@]}" apt-get update -qq
"${sudo_cmd[@]}" apt-get install -y -qq --no-install-recommends "${missing[@]}"
install_web_test_modules
