#!/usr/bin/env bash
# Installs the Debian packages that the build, the tests and the main job
# need, when any is missing. Safe to run again: it does nothing then.
set -euo pipefail

packages=(cmake ninja-build g++ libgtest-dev nlohmann-json3-dev libbenchmark-dev libspdlog-dev
          g++-multilib googletest)

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

# The 32-bit build (cmake/m32.cmake) runs its programs natively where the
# kernel executes i386 code, and under qemu-i386 elsewhere.
probe=$(mktemp -d)
if ! { echo 'int main(void) { return 0; }' | cc -m32 -x c -o "$probe/probe" - && "$probe/probe"; } 2>/dev/null &&
   ! command -v qemu-i386 >/dev/null; then
  sudo=""
  [ "$(id -u)" -ne 0 ] && sudo=sudo
  echo "Installing: qemu-user (this machine cannot run i386 programs)"
  $sudo apt-get update -qq
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends qemu-user
fi
rm -rf "$probe"
