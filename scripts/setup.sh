#!/usr/bin/env bash
# Installs what a fresh Debian machine lacks to build and test Mox (i386 build
# on an x86-64 host). Installs nothing when everything is already present.
set -euo pipefail

packages=(cmake g++ g++-multilib lib32asan8 lib32ubsan1 googletest file
  python3 util-linux bsdutils iproute2)

missing=()
for p in "${packages[@]}"; do
  dpkg -s "$p" >/dev/null 2>&1 || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "setup: installing ${missing[*]}"
  if [ "$(id -u)" -ne 0 ]; then
    echo "setup: run as root (or install them yourself): ${missing[*]}" >&2
    exit 1
  fi
  apt-get update -qq
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq "${missing[@]}" >/dev/null
fi
