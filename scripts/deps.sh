#!/usr/bin/env bash
# Installs the Debian packages that the build, the tests and the main job
# need, when any is missing. Safe to run again: it does nothing then.
set -euo pipefail

packages=(cmake ninja-build g++ libgtest-dev nlohmann-json3-dev)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done

if ((${#missing[@]})); then
  sudo=""
  [ "$(id -u)" -ne 0 ] && sudo=sudo
  echo "Installing: ${missing[*]}"
  $sudo apt-get update -qq
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq "${missing[@]}"
fi
