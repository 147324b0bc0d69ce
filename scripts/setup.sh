#!/usr/bin/env bash
# Installs the Debian packages the build and the tests need, and nothing else.
# Not root and something missing: print the one apt-get line to run and stop.
set -euo pipefail

# `setup.sh tests` adds what the tests need.
packages=(g++ make cmake pkg-config libbsd-dev nlohmann-json3-dev)
if [ "${1:-}" = tests ]; then
    # A real OpenMetrics parser and promtool's metrics lint for the tests.
    packages+=(googletest libgtest-dev python3-prometheus-client prometheus)
fi

missing=()
for p in "${packages[@]}"; do
    if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
        missing+=("$p")
    fi
done

[ ${#missing[@]} -eq 0 ] && exit 0

if [ "$(id -u)" -ne 0 ]; then
    echo "apt-get update && apt-get install -y ${missing[*]}" >&2
    exit 1
fi

export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends "${missing[@]}"
