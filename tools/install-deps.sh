#!/usr/bin/env bash
# Installs the Debian 12 packages needed to build, test and benchmark the library (OpenCV's
# Python module is the oracle of the camera-model tests).
set -euo pipefail
packages=(cmake g++ make pkg-config googletest libgtest-dev libgmock-dev libbenchmark-dev
          libxerces-c-dev libgdal-dev libproj-dev proj-data proj-bin gdal-bin
          libxml2-utils locales python3-opencv)
missing=()
for p in "${packages[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if ((${#missing[@]})); then
    sudo_cmd=()
    [[ $(id -u) -ne 0 ]] && sudo_cmd=(sudo)
    "${sudo_cmd[@]}" apt-get update -qq
    DEBIAN_FRONTEND=noninteractive "${sudo_cmd[@]}" apt-get install -y -qq "${missing[@]}"
fi

# Locales with a decimal comma and with a dotless capital I, for the tests that check that
# numbers and keywords read the same under any locale.
for loc in de_DE tr_TR; do
    if ! locale -a 2>/dev/null | grep -qi "^${loc}\.utf-\?8$"; then
        sudo_cmd=()
        [[ $(id -u) -ne 0 ]] && sudo_cmd=(sudo)
        "${sudo_cmd[@]}" localedef -i "$loc" -f UTF-8 "$loc.UTF-8" || true
    fi
done
