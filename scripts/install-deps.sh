#!/usr/bin/env bash
# Installs the Debian packages Pelmora builds, tests and benchmarks with.
# Idempotent: only missing packages are installed, so a warm machine pays nothing.
set -euo pipefail

packages=(
  g++ cmake ninja-build ccache pkg-config make
  libboost-dev libboost-regex-dev libboost-date-time-dev
  libexpat1-dev zlib1g-dev libssl-dev
  libgtest-dev libgmock-dev libbenchmark-dev libfmt-dev libxml2-dev libpugixml-dev
  libspdlog-dev
  libsqlite3-dev  # the authorisation store
  prometheus  # promtool checks the metrics export in the tests
  clang libclang-rt-14-dev clang-format
  openssl  # the TLS stream tests make throw-away certificates
  curl python3  # real clients in the HTTP tests
  python3-zeep  # a real SOAP client drives the SOAP tests
  chromium chromium-driver python3-selenium  # the status page in a real browser
  nginx  # a front proxy before two daemons
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
    missing+=("$p")
  fi
done

[ ${#missing[@]} -eq 0 ] && exit 0

if [ "$(id -u)" -eq 0 ]; then
  echo "install-deps: installing ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
else
  echo "install-deps: missing packages; run:" >&2
  echo "  sudo apt-get update && sudo apt-get install -y ${missing[*]}" >&2
  exit 1
fi
