#!/usr/bin/env bash
# Installs what a fresh Debian machine lacks to build and test Mox (i386 build
# on an x86-64 host). Installs nothing when everything is already present.
set -euo pipefail

# python3-aiosmtpd and postfix: the loopback SMTP servers that the e-mail
# delivery tests talk to (postfix is installed unconfigured, so no system mail
# service is set up or started; the tests run a private instance).
# man-db, groff-base, bsdextrautils (col) and systemd (systemd-analyze): the
# installation tests render the manual page and verify the unit; systemd is
# only installed, never started.
# python3, util-linux (unshare, nsenter), mount, bsdutils (logger) and
# iproute2: the end-to-end testbed.
# clang-14 and libclang-rt-14-dev: the fuzz targets (libFuzzer, i386 runtime).
# libc6:i386, libstdc++6:i386, libgcc-s1:i386 (the i386 architecture added to
# dpkg): dpkg-shlibdeps computes the package's Depends from the i386
# packages' own libraries and symbols files. lintian: the package test.
packages=(cmake g++ g++-multilib lib32asan8 lib32ubsan1 googletest file python3-aiosmtpd postfix
          binutils man-db groff-base bsdextrautils systemd
          python3 util-linux mount bsdutils iproute2
          clang-14 libclang-rt-14-dev
          libc6:i386 libstdc++6:i386 libgcc-s1:i386 lintian)

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
  dpkg --print-foreign-architectures | grep -qx i386 || dpkg --add-architecture i386
  apt-get update -qq
  echo "postfix postfix/main_mailer_type select No configuration" | debconf-set-selections
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq "${missing[@]}" >/dev/null
fi

# Some x86-64 kernels cannot run 32-bit x86 programs (IA32 emulation left out
# or switched off). There the i386 build runs under qemu's user-mode emulator,
# attached through binfmt_misc, so the tests still run the binaries as built.
i386_runs() {
  local dir rc=0
  dir=$(mktemp -d)
  printf 'int main(void) { return 0; }\n' >"$dir/probe.c"
  if gcc -m32 "$dir/probe.c" -o "$dir/probe" 2>/dev/null; then
    timeout 20 "$dir/probe" 2>/dev/null || rc=1
  fi
  rm -rf "$dir"
  return $rc
}
if ! i386_runs; then
  if [ "$(id -u)" -ne 0 ]; then
    echo "setup: this kernel cannot run i386 programs; as root, setup attaches qemu-i386 through binfmt_misc" >&2
    exit 1
  fi
  dpkg -s qemu-user-static >/dev/null 2>&1 ||
    DEBIAN_FRONTEND=noninteractive apt-get install -y -qq qemu-user-static >/dev/null
  binfmt=/proc/sys/fs/binfmt_misc
  [ -e "$binfmt/register" ] || mount -t binfmt_misc binfmt_misc "$binfmt"
  if [ ! -e "$binfmt/qemu-i386" ]; then
    # ELF, 32-bit, little-endian, executable or shared object, machine 3 (i386);
    # F: the interpreter is opened now, so it also serves mount namespaces.
    echo ':qemu-i386:M::\x7fELF\x01\x01\x01\x00\x00\x00\x00\x00\x00\x00\x00\x00\x02\x00\x03\x00:\xff\xff\xff\xff\xff\xfe\xfe\x00\xff\xff\xff\xff\xff\xff\xff\xff\xfe\xff\xff\xff:/usr/bin/qemu-i386-static:FP' >"$binfmt/register"
  fi
  i386_runs || { echo "setup: i386 programs still cannot run" >&2; exit 1; }
  echo "setup: i386 programs run under qemu-i386 on this kernel"
fi
