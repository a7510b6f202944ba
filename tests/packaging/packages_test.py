"""The packages: Debian's own checks, and programs that use the installed library."""

import os
import pathlib
import re
import subprocess
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["QUARVEL_SOURCE"])
BUILD = pathlib.Path(os.environ["QUARVEL_BUILD"])
PACKAGES = sorted((BUILD / "packages").glob("*.deb"))
STRICT = "-Wall", "-Wextra", "-Wpedantic", "-Werror"


def run(*command, **options):
    done = subprocess.run(list(map(str, command)), capture_output=True, text=True, timeout=600, **options)
    if done.returncode != 0:
        raise AssertionError(f"{command}: {done.returncode}\n{done.stdout}{done.stderr}")
    return done.stdout


class Packages(unittest.TestCase):
    def test_lintian_finds_no_fault(self):
        run("lintian", "--allow-root", "--fail-on", "error,warning", *PACKAGES)

    def test_they_are_the_same_every_time(self):
        with tempfile.TemporaryDirectory() as directory:
            run("cpack", "--config", BUILD / "CPackConfig.cmake", "-B", directory)
            for package in PACKAGES:
                again = pathlib.Path(directory) / package.name
                self.assertEqual(again.read_bytes(), package.read_bytes(), package.name)

    def test_the_library_s_name_and_the_package_s_agree(self):
        soname = re.search(r"SONAME.*\[(.*)\.so\.(\d+)\]",
                           run("readelf", "-d", BUILD / "client/libquarvel.so")).groups()
        names = [package.name.split("_")[0] for package in PACKAGES]
        self.assertEqual(names, ["libquarvel-dev", "".join(soname), "quarvel-tools", "quarvel"])
        self.assertIn(f"{soname[0]} {soname[1]} {''.join(soname)} ", run("dpkg-deb", "--info", PACKAGES[1], "shlibs"))

    def test_the_probe_is_in_the_service(self):
        with tempfile.TemporaryDirectory() as directory:
            run("dpkg-deb", "-x", PACKAGES[-1], directory)
            notes = run("readelf", "-n", pathlib.Path(directory) / "usr/sbin/quarveld")
        self.assertRegex(notes, r"Provider: quarvel\s+Name: event\s+.*\s+Arguments: 4@\S+( 8@\S+){4}")


class Installed(unittest.TestCase):
    """The packages unpacked into a directory, and used from there."""

    @classmethod
    def setUpClass(cls):
        cls.tree = pathlib.Path(cls.enterClassContext(tempfile.TemporaryDirectory(prefix="quarvel-tree-")))
        for package in PACKAGES:
            run("dpkg-deb", "-x", package, cls.tree)
        [cls.libraries] = [path.parent for path in cls.tree.glob("usr/lib/**/libquarvel.so")]
        cls.examples = cls.tree / "usr/share/doc/quarvel/examples"
        cls.environment = dict(os.environ, QUARVEL_PREFIX=str(cls.tree / "usr"),
                               LD_LIBRARY_PATH=str(cls.libraries), PKG_CONFIG_SYSROOT_DIR=str(cls.tree),
                               PKG_CONFIG_PATH=str(cls.libraries / "pkgconfig"))

    def test_the_examples_are_built_by_the_cmake_package_and_speak_to_the_service(self):
        run("/usr/bin/python3", SOURCE / "tests/client/examples_test.py", self.examples, env=self.environment)

    def test_pkg_config_builds_them_too(self):
        flags = run("pkg-config", "--cflags", "--libs", "quarvel", env=self.environment).split()
        for compiler, source in ((["cc", "-std=gnu99"], "client.c"), (["c++", "-std=c++20"], "client.cc")):
            run(*compiler, *STRICT, self.examples / source, "-o", self.tree / source.replace(".", "-"), *flags)

    def test_each_header_needs_nothing_but_the_standard_library(self):
        headers = self.tree / "usr/include"
        for header in sorted(headers.rglob("*.h*")):
            for language in (("-xc", "-std=c99"), ("-xc++", "-std=c++20"))[header.name != "quarvel.h":]:
                run("cc", "-fsyntax-only", *language, *STRICT, "-I", headers, "-include", header, "/dev/null")
