#!/usr/bin/env bash
# Installs the Debian packages the build, the tests and the benchmarks need.
# Idempotent and quiet: packages already present are skipped, and apt is
# touched only when something is missing.
set -euo pipefail

packages=(
  build-essential cmake pkg-config python3 clang-format clang-14 libclang-rt-14-dev
  zlib1g-dev libbz2-dev liblzma-dev libzstd-dev libssl-dev openssl
  libpugixml-dev libacl1-dev libplist-dev libcurl4-openssl-dev libisal-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  unzip zip libarchive-tools 7zip unar macutils nginx
  hyperfine time strace
)

missing=()
for p in "${packages[@]}"; do
  status=$(dpkg-query -W -f='${Status}' "$p" 2>/dev/null || true)
  [[ "$status" == "install ok installed" ]] || missing+=("$p")
done

((${#missing[@]} == 0)) && exit 0

if [[ $(id -u) -ne 0 ]]; then
  sudo=sudo
else
  sudo=
fi
echo "installing: ${missing[*]}" >&2
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq >/dev/null
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
