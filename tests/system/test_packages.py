"""What is installed: that it is all there, that it works from where it is, and that it goes away again."""

import glob
import os
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.dirname(__file__))

from cindral_rpc import PATIENCE, SystemTest  # noqa: E402

BUILD = os.environ.get("CINDRAL_BUILD", "")
EXAMPLES = os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "..", "examples")
COMPILER = os.environ.get("CINDRAL_CXX", "c++")
FLAGS = os.environ.get("CINDRAL_CXX_FLAGS", "")


def run(*words, **how):
    """Standard output of a program that has to succeed; what it said where it does not."""
    done = subprocess.run(words, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=600, check=False, **how)
    if done.returncode != 0:
        raise AssertionError(f"{words}: {done.returncode}\n{done.stdout.decode()}\n{done.stderr.decode()}")
    return done.stdout.decode()


def files_below(folder):
    return {os.path.relpath(os.path.join(path, name), folder) for path, _, names in os.walk(folder) for name in names}


class PackagesTest(SystemTest):
    def install(self, *words):
        prefix = os.path.join(self.folder, "prefix")
        run("cmake", "--install", BUILD, "--prefix", prefix, *words)
        return prefix

    def of_prefix(self, prefix):
        return {**self.environment, "PATH": os.path.join(prefix, "bin") + ":" + self.environment["PATH"]}

    def assert_complete(self, prefix, known_as=None):
        """All is below the prefix, and the daemon is started where it will be known."""
        files = files_below(prefix)
        for file in ("bin/cindral", "libexec/cindral/cindral-render-svg", "lib/systemd/user/cindral.service", "lib/systemd/user/cindral.socket",
                     "share/man/man1/cindral.1", "share/bash-completion/completions/cindral", "share/zsh/vendor-completions/_cindral",
                     "share/fish/vendor_completions.d/cindral.fish", "include/cindral/Client.h"):
            self.assertIn(file, files)
        for name in ("libcindral.a", "cindral.pc", "cindralConfig.cmake", "cindralConfigVersion.cmake", "cindralTargets.cmake"):
            self.assertEqual(sum(os.path.basename(file) == name for file in files), 1, name)
        with open(os.path.join(prefix, "lib/systemd/user/cindral.service"), encoding="utf-8") as unit:
            self.assertIn(f"ExecStart={known_as or prefix}/bin/cindral serve\n", unit.read())

    def assert_follows(self, program, prefix):
        """The example lists the folder, and tells of what then happens."""
        self.make_file("sub", "there before.txt")
        process = subprocess.Popen([program, self.path("sub"), self.storage, self.state], env=self.of_prefix(prefix), stdin=subprocess.DEVNULL,
                                   stdout=subprocess.PIPE, stderr=subprocess.PIPE)
        self.addCleanup(process.stderr.close)
        self.addCleanup(process.stdout.close)
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        first = process.stdout.readline()
        self.assertEqual(first, b"listed   there before.txt\n", "" if first else process.stderr.read())
        self.make_file("sub", "new.txt")
        self.assertIn(b"updated  new.txt\n", iter(process.stdout.readline, b""))
        os.rename(self.path("sub", "there before.txt"), self.path("gone.txt"))
        self.assertTrue(any(line.startswith(b"deleted  ") for line in iter(process.stdout.readline, b"")))

    def test_the_example_follows_a_folder_by_the_cmake_package(self):
        prefix = self.install()
        self.assert_complete(prefix)
        build = os.path.join(self.folder, "build")
        run("cmake", "-S", EXAMPLES, "-B", build, f"-DCMAKE_PREFIX_PATH={prefix}", f"-DCMAKE_CXX_COMPILER={COMPILER}", f"-DCMAKE_CXX_FLAGS={FLAGS}")
        run("cmake", "--build", build)
        self.assert_follows(os.path.join(build, "follow"), prefix)

    def test_the_example_follows_a_folder_by_pkg_config_and_a_daemon(self):
        prefix = self.install()
        found = [os.path.dirname(path) for path in glob.glob(os.path.join(prefix, "**", "cindral.pc"), recursive=True)]
        flags = run("pkg-config", "--cflags", "--libs", "cindral", env={**self.environment, "PKG_CONFIG_PATH": found[0]}).split()
        program = os.path.join(self.folder, "follow")
        run(COMPILER, "-std=gnu++20", "-Wall", "-Wextra", "-Werror", os.path.join(EXAMPLES, "follow.cpp"), "-o", program, *flags, *FLAGS.split())
        self.daemon()
        self.assert_follows(program, prefix)
        self.assert_connects(flags)
        # A folder that is not there is told of by the host's own words.
        done = subprocess.run([program, self.path("none"), self.storage, self.state], env=self.of_prefix(prefix), stdin=subprocess.DEVNULL,
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=PATIENCE, check=False)
        self.assertEqual((done.returncode, done.stdout), (1, b""))
        self.assertTrue(done.stderr.startswith(b"follow: "), done.stderr)

    def assert_connects(self, flags):
        """A program that knows the daemon's socket needs no other."""
        source = os.path.join(self.folder, "connect.cpp")
        with open(source, "w", encoding="ascii") as file:
            file.write("""
                #include <cindral/Client.h>
                #include <iostream>
                int main(int, char** words) {
                    auto client = cindral::Client::connect(words[1]);
                    if (!client.ok()) return std::cerr << client.error().message << "\\n", 1;
                    const auto identifier = client->identifierAt(words[2]);
                    const auto item = identifier.ok() ? client->item(*identifier) : identifier.error();
                    if (!item.ok()) return std::cerr << item.error().message << "\\n", 2;
                    std::cout << item->filename << "\\n";
                }
                """)
        program = os.path.join(self.folder, "connect")
        run(COMPILER, "-std=gnu++20", "-Wall", "-Wextra", "-Werror", source, "-o", program, *flags, *FLAGS.split())

        def connect(socket, path):
            done = subprocess.run([program, socket, path], stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                                  timeout=PATIENCE, check=False, text=True)
            return done.returncode, done.stdout, done.stderr

        path = self.make_file("sub", "there.txt")
        socket = os.path.join(self.state, "socket")
        self.assertEqual(connect(socket, path), (0, "there.txt\n", ""))
        self.assertEqual(connect(socket, self.path("none"))[:2], (2, ""))
        for nobody, why in ((self.path("none"), "No such file or directory"), (path, "Connection refused"), ("x" * 200, "File name too long")):
            self.assertEqual(connect(nobody, path), (1, "", f"can't connect to {nobody}: {why}\n"))

    def test_uninstalling_leaves_documents_and_state_alone(self):
        prefix = self.install()
        document = self.make_file("kept.txt", contents=b"kept")
        run(os.path.join(prefix, "bin", "cindral"), "ls", *self.options(), env=self.environment)
        state = files_below(self.state)
        self.assertTrue(state)
        strangers = os.path.join(prefix, "include", "other.h")
        with open(strangers, "w", encoding="ascii"):
            pass
        manifest = os.path.join(self.folder, "manifest")
        with open(manifest, "w", encoding="utf-8") as file:
            file.write("\n".join(os.path.join(prefix, name) for name in files_below(prefix) if name != "include/other.h"))
        script = os.path.join(EXAMPLES, "..", "cmake", "Uninstall.cmake")
        run("cmake", f"-DMANIFEST={manifest}", "-P", script)
        self.assertEqual(files_below(prefix), {"include/other.h"})
        self.assertFalse(os.path.exists(os.path.join(prefix, "libexec", "cindral")))
        self.assertEqual(files_below(self.state), state)
        with open(document, "rb") as file:
            self.assertEqual(file.read(), b"kept")

    def test_a_debian_package_has_what_it_needs_and_works_where_it_is_unpacked(self):
        packages = os.path.join(self.folder, "packages")
        run("cpack", "--config", os.path.join(BUILD, "CPackConfig.cmake"), "-G", "DEB", "-B", packages)
        (package,) = glob.glob(os.path.join(packages, "*.deb"))
        depends = run("dpkg-deb", "--field", package, "Depends")
        for needed in ("libc6", "libfmt9", "liblmdb0", "libsqlite3-0", "libpng16-16", "librsvg2-2", "libicu", "shared-mime-info"):
            self.assertIn(needed, depends)
        # Nothing runs when it comes or goes: what it leaves behind is what was there.
        self.assertEqual(set(os.listdir(self.unpacked(package, "--control"))) - {"control", "md5sums"}, set())
        root = self.unpacked(package, "--extract")
        self.assertEqual(os.listdir(root), ["usr"])
        self.assert_complete(os.path.join(root, "usr"), known_as="/usr")
        self.make_file("report.txt")
        program = os.path.join(root, "usr", "bin", "cindral")
        self.assertIn("report.txt", run(program, "ls", *self.options(), env=self.environment))

    def test_a_debian_package_goes_and_leaves_documents_and_state(self):
        packages = os.path.join(self.folder, "packages")
        run("cpack", "--config", os.path.join(BUILD, "CPackConfig.cmake"), "-G", "DEB", "-B", packages)
        (package,) = glob.glob(os.path.join(packages, "*.deb"))
        root = os.path.join(self.folder, "root")
        database = os.path.join(root, "var", "lib", "dpkg")
        os.makedirs(os.path.join(database, "updates"))
        os.makedirs(os.path.join(database, "info"))
        for name in ("status", "available"):
            with open(os.path.join(database, name), "w", encoding="ascii"):
                pass
        # An empty system has none of what the package needs, and belongs to whoever runs the test.
        dpkg = ["dpkg", f"--root={root}", f"--log={self.folder}/log", "--force-depends", "--force-not-root", "--force-bad-path"]
        run(*dpkg, "--install", package, env=self.environment)
        program = os.path.join(root, "usr", "bin", "cindral")
        document = self.make_file("kept.txt", contents=b"kept")
        self.assertIn("kept.txt", run(program, "ls", *self.options(), env=self.environment))
        state = files_below(self.state)
        run(*dpkg, "--purge", "cindral", env=self.environment)
        self.assertFalse(os.path.exists(program))
        self.assertFalse(os.path.exists(os.path.join(root, "usr")))
        self.assertEqual(files_below(self.state), state)
        with open(document, "rb") as file:
            self.assertEqual(file.read(), b"kept")

    def unpacked(self, package, what):
        folder = os.path.join(self.folder, "unpacked" + what)
        run("dpkg-deb", what, package, folder)
        return folder


if __name__ == "__main__":
    unittest.main()
