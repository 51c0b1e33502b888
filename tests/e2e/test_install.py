"""Installation: the layout `cmake --install` produces, the installed daemon
running from it, and the Debian package built by CPack."""

import configparser
import os
import re
import shutil
import stat
import subprocess
import tempfile
import unittest

from testbed import LOG_INFO, BedTestCase

# Files of the installation, relative to the root; with the file mode they need.
INSTALLED = {
    "usr/local/ubo/bin/mox": 0o755,
    "usr/local/ubo/bin/dmictl": 0o755,
    "usr/local/ubo/lib/libdmisp.so": 0o644,  # shared objects are not executables (Debian)
    "var/dmi/mifs/backup/mox.mif": 0o644,
    "lib/systemd/system/mox.service": 0o644,
    "usr/share/man/man8/mox.8": 0o644,
}


def build_dir():
    path = os.environ.get("MOX_BINARY_DIR")
    if not path or not os.path.isfile(os.path.join(path, "CMakeCache.txt")):
        raise unittest.SkipTest("MOX_BINARY_DIR does not name a configured build tree")
    return path


class InstallTest(BedTestCase):

    def setUp(self):
        self.root = tempfile.mkdtemp(prefix="moxe2e-install.")
        self.addCleanup(shutil.rmtree, self.root, True)

    def install(self):
        destdir = os.path.join(self.root, "dest")
        subprocess.run(["cmake", "--install", build_dir()], env=dict(os.environ, DESTDIR=destdir),
                       check=True, capture_output=True)
        return destdir

    def test_installed_layout(self):
        destdir = self.install()
        files = sorted(os.path.relpath(os.path.join(d, f), destdir)
                       for d, _, names in os.walk(destdir) for f in names)
        self.assertEqual(files, sorted(INSTALLED))
        for name, mode in INSTALLED.items():
            self.assertEqual(stat.S_IMODE(os.stat(os.path.join(destdir, name)).st_mode), mode, name)
        with open(os.path.join(os.environ["MOX_SOURCE_DIR"], "mifs", "mox.mif"), "rb") as f:
            source = f.read()
        with open(os.path.join(destdir, "var/dmi/mifs/backup/mox.mif"), "rb") as f:
            self.assertEqual(f.read(), source)

        unit = configparser.ConfigParser(strict=False, interpolation=None)
        unit.optionxform = str
        unit.read(os.path.join(destdir, "lib/systemd/system/mox.service"))
        service = unit["Service"]
        # The daemon does not detach, and looks for its marker files in its
        # working directory.
        self.assertEqual(service["Type"], "simple")
        self.assertEqual(service["WorkingDirectory"], "/usr/local/ubo/bin")
        self.assertEqual(service["ExecStart"], "/usr/local/ubo/bin/mox")
        self.assertEqual(service["KillSignal"], "SIGTERM")
        self.assertGreater(int(service["TimeoutStopSec"]), 10)
        self.assertEqual(unit["Install"]["WantedBy"], "multi-user.target")

        groff = shutil.which("groff")
        self.assertIsNotNone(groff, "groff (groff-base) is needed to check the man page")
        page = subprocess.run([groff, "-man", "-Tutf8", "-ww", os.path.join(destdir, "usr/share/man/man8/mox.8")],
                              capture_output=True)
        self.assertEqual(page.stderr, b"", "man page warnings")
        text = re.sub(".\x08", "", page.stdout.decode())  # bold and underline by overstriking
        for section in ("NAME", "SYNOPSIS", "MARKER FILES", "CONFIGURATION", "ACTIONS TABLES", "SIGNALS",
                        "EXIT STATUS", "FILES", "ENVIRONMENT"):
            self.assertIn("\n" + section + "\n", text, section)

    def test_installed_daemon_runs_from_its_layout(self):
        # The installed daemon finds its provider library beside it and
        # installs mox.mif from /var/dmi/mifs/backup (no UXDMIPATH).
        destdir = self.install()
        bed = self.bed("installed", mifs=False, binds=[[os.path.join(destdir, "var/dmi"), "/var/dmi"]],
                       unset=["UXDMIPATH"])
        mox = bed.spawn([os.path.join(destdir, "usr/local/ubo/bin/mox")])
        self.assertLogged(bed, "MOX - installed mox.mif\n", LOG_INFO)
        self.assertTrue(mox.running(), mox.stderr.data)
        self.assertIn("Zorek Tessarin Server Manager - Mox", bed.dmictl("list"))

    def test_debian_package(self):
        cpack = shutil.which("cpack")
        dpkg_deb = shutil.which("dpkg-deb")
        if cpack is None or dpkg_deb is None:
            self.skipTest("cpack or dpkg-deb not installed")
        out = os.path.join(self.root, "package")
        subprocess.run([cpack, "-G", "DEB", "-B", out], cwd=build_dir(), check=True, capture_output=True)
        debs = [n for n in os.listdir(out) if n.endswith(".deb")]
        self.assertEqual(len(debs), 1, os.listdir(out))
        deb = os.path.join(out, debs[0])
        fields = {}
        for field in ("Package", "Version", "Architecture", "Section"):
            fields[field] = subprocess.run([dpkg_deb, "-f", deb, field], check=True,
                                           capture_output=True).stdout.decode().strip()
        self.assertEqual(fields, {"Package": "mox", "Version": "2.93", "Architecture": "i386", "Section": "admin"})
        listing = subprocess.run([dpkg_deb, "-c", deb], check=True, capture_output=True).stdout.decode()
        entries = {}
        for line in listing.splitlines():
            parts = line.split()
            entries[parts[-1].lstrip(".").lstrip("/")] = parts[0]
        files = {name: mode for name, mode in entries.items() if not mode.startswith("d")}
        self.assertEqual(sorted(files), sorted(INSTALLED))
        self.assertEqual(files["usr/local/ubo/bin/mox"], "-rwxr-xr-x")
        self.assertEqual(files["lib/systemd/system/mox.service"], "-rw-r--r--")
        # The package's daemon is the one built here.
        extract = os.path.join(self.root, "extract")
        subprocess.run([dpkg_deb, "-x", deb, extract], check=True)
        with open(os.path.join(extract, "usr/local/ubo/bin/mox"), "rb") as f:
            packaged = f.read()
        with open(os.path.join(self.install(), "usr/local/ubo/bin/mox"), "rb") as f:
            self.assertEqual(packaged, f.read())


if __name__ == "__main__":
    unittest.main()
