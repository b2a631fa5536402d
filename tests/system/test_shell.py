"""What shells, manuals and pipes get of the program."""

import os
import re
import shutil
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.dirname(__file__))

from cindral_rpc import PATIENCE, PROGRAM, SystemTest  # noqa: E402

TEXTS = os.environ.get("CINDRAL_SHELL_TEXTS", "")
COMPLETIONS = {"bash": "cindral.bash", "zsh": "_cindral", "fish": "cindral.fish"}


def run(*words, **how):
    done = subprocess.run(words, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=PATIENCE, check=False, **{"stdin": subprocess.DEVNULL, **how})
    return done.returncode, done.stdout.decode(), done.stderr.decode()


class ShellTest(SystemTest):
    def said(self, *words):
        status, output, error = run(PROGRAM, *words, env=self.environment)
        self.assertEqual((status, error), (0, ""))
        return output

    def commands(self):
        """The names of all commands, as the manual has them."""
        section = self.said("--manual").split(".SH COMMANDS\n")[1].split("\n.SH ")[0]
        names = {name.replace("\\-", "-") for name in re.findall(r"^\.B ([a-z\\-]+)", section, re.MULTILINE) if not name.startswith("\\-")}
        self.assertTrue({"ls", "serve", "rm", "empty-trash"} <= names, names)
        return names

    def bare(self, *words, **how):
        """The names that a list prints, as they are."""
        done = subprocess.run([PROGRAM, *words, "-0", *self.options()], env=self.environment, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE,
                              stderr=subprocess.PIPE, timeout=PATIENCE, check=False, **how)
        self.assertEqual((done.returncode, done.stderr), (0, b""))
        self.assertTrue(not done.stdout or done.stdout.endswith(b"\0"), done.stdout)
        return done.stdout.split(b"\0")[:-1]

    def test_help_fits_a_screen_and_names_every_command(self):
        lines = self.said("--help").splitlines()
        self.assertLessEqual(len(lines), 24)
        self.assertLessEqual(max(map(len, lines)), 80, lines)
        words = set(" ".join(lines).split())
        self.assertEqual(self.commands() - words, set())
        # A command that nobody gave a place would stand under this.
        self.assertNotIn("More", words)

    def test_what_is_installed_is_what_the_program_says(self):
        self.assertTrue(TEXTS, "CINDRAL_SHELL_TEXTS names the folder")
        with open(os.path.join(TEXTS, "cindral.1"), encoding="utf-8") as file:
            self.assertEqual(file.read(), self.said("--manual"))
        for shell, name in COMPLETIONS.items():
            with open(os.path.join(TEXTS, name), encoding="utf-8") as file:
                self.assertEqual(file.read(), self.said("--completion", shell))
        self.assertEqual(run(PROGRAM, "--completion", "tea", env=self.environment)[0], 2)

    def test_the_manual_is_clean_and_has_every_word(self):
        page = self.said("--manual")
        self.assertEqual(run("groff", "-man", "-ww", "-Kutf8", "-Tutf8", "-z", input=page.encode(), stdin=None), (0, "", ""))
        status, output, _ = run("mandoc", "-Tlint", "-Werror", input=page.encode(), stdin=None)
        self.assertEqual((status, output), (0, ""))
        shown = run("groff", "-man", "-Kutf8", "-Tascii", "-P-cbou", input=page.encode(), stdin=None)[1]
        words = set(re.split(r"[\s,]+", shown))
        for option in ("--storage", "--state", "--json", "--recorder", "--since", "--limit", "--keep-both", "--null", "--http"):
            self.assertIn(option, words)
        self.assertIn("cindral - items with lasting identifiers", shown)
        self.assertIn("\\xNN", shown)

    def test_completions_are_read_by_their_shells(self):
        for shell, name in COMPLETIONS.items():
            self.assertEqual(run(shutil.which(shell), "-n", os.path.join(TEXTS, name), env=self.environment), (0, "", ""), shell)

    def completed(self, *words, cwd=None):
        """What bash offers for the last word."""
        script = 'source "$1"; shift; COMP_WORDS=(cindral "$@"); COMP_CWORD=$#; compopt() { :; }; _cindral; printf "%s\\n" "${COMPREPLY[@]}"'
        status, output, error = run("bash", "-c", script, "bash", os.path.join(TEXTS, "cindral.bash"), *words, env=self.environment, cwd=cwd)
        self.assertEqual((status, error), (0, ""))
        return set(output.split("\n")) - {""}

    def test_bash_completes_commands_options_and_items(self):
        self.assertEqual(self.completed("fav"), {"favorite", "favorites"})
        self.assertLessEqual(self.commands() - {"apps enable"}, self.completed(""))
        self.assertEqual(self.completed("--storage", "/x", "tre"), {"tree"})
        self.assertEqual(self.completed("tree", "--pa"), {"--packages"})
        self.assertEqual(self.completed("ls", "--pa"), set())
        self.assertEqual(self.completed("--recorder", "f"), {"fanotify"})
        self.assertEqual(self.completed("apps", "en"), {"enable"})
        self.make_file("some file.txt")
        os.mkdir(self.path("folder"))
        self.assertEqual(self.completed("info", "so", cwd=self.storage), {"some file.txt"})
        self.assertEqual(self.completed("--storage", "", cwd=self.storage), {"folder"})
        self.assertEqual(self.completed("find", "so", cwd=self.storage), set())

    def test_fish_completes_commands_and_options(self):
        def completed(line):
            status, output, error = run("fish", "--no-config", "-c", f"source {os.path.join(TEXTS, 'cindral.fish')}; complete -C '{line}'",
                                        env=self.environment)
            self.assertEqual((status, error), (0, ""))
            return {each.split("\t")[0] for each in output.splitlines()}
        self.assertLessEqual({"favorite", "favorites"}, completed("cindral fav"))
        self.assertLessEqual(self.commands(), completed("cindral "))
        self.assertIn("--packages", completed("cindral tree --pa"))
        self.assertEqual(completed("cindral --recorder f"), {"fanotify"})

    def test_lists_for_pipes_are_bare_paths(self):
        odd = os.fsencode(self.path("sub")) + b"/a\nb \xff\x1b[2J"
        self.make_file("sub", b"a\nb \xff\x1b[2J")
        self.make_file("sub", "plain")
        sub, plain = os.fsencode(self.path("sub")), os.fsencode(self.path("sub", "plain"))
        self.assertEqual(set(self.bare("ls", self.path("sub"))), {odd, plain})
        self.assertEqual(set(self.bare("tree")), {sub, odd, plain})
        self.assertEqual(set(self.bare("recents")), {odd, plain})
        self.assertEqual(self.bare("find", "plain"), [plain])
        self.assertEqual(self.bare("find", "nothing at all"), [])
        self.assertEqual(self.bare("ls", plain), [plain])
        (identifier,) = self.bare("id", self.path("sub"))
        self.assertEqual(set(self.bare("ls", identifier)), {odd, plain})

    def test_what_a_list_prints_names_items_to_every_command(self):
        odd = self.make_file("sub", b"a\nb")
        for command in (["tag", "red"], ["favorite"], ["trash"]):
            names = self.bare("ls", self.path("sub"))
            self.assertEqual(len(names), 1)
            self.assertEqual(self.run_program(*command, *names), (0, b"", b""))
            if command == ["tag", "red"]:
                self.assertEqual(self.bare("tagged", "red"), [os.fsencode(odd)])
                self.assertEqual((self.bare("tags"), self.bare("tags", odd)), ([b"red"], [b"red"]))
            if command == ["favorite"]:
                self.assertEqual(self.bare("favorites"), [os.fsencode(odd)])
        (trashed,) = self.bare("trash")
        self.assertEqual(self.run_program("restore", trashed), (0, b"", b""))
        self.assertEqual(self.bare("ls", self.path("sub")), [os.fsencode(odd)])

    def test_items_are_named_by_path_or_identifier_in_every_command(self):
        for command in (["ls"], ["tree"], ["info"], ["url"], ["anchor"], ["tags"], ["tag", "red"], ["untag", "red"], ["favorite"], ["unfavorite"],
                        ["touch-used"]):
            # Only what is in a folder has an anchor.
            path = self.path("sub") if command == ["anchor"] else self.make_file("sub", "a b")
            identifier = self.run_program("id", path)[1].strip()
            for item in (path, identifier):
                status, _, error = self.run_program(*command, item)
                self.assertEqual((status, error), (0, b""), (command, item))

    def test_single_values_may_end_with_a_nul_too(self):
        odd = self.make_file("sub", b"a\nb \xff%")
        identifier = self.bare("id", odd)
        self.assertEqual(self.run_program("id", odd)[1].splitlines(), identifier)
        url = b"file://" + os.fsencode(self.path("sub")) + b"/a%0Ab%20%FF%25"
        self.assertEqual(self.bare("url", odd), [url])
        self.assertEqual(self.bare("url", identifier[0].decode()), [url])

    def test_bare_names_and_json_exclude_each_other(self):
        for words in (["ls", "-0", "--json"], ["--json", "find", "x", "--null"], ["info", "-0", self.storage]):
            status, output, error = self.run_program(*words)
            self.assertEqual((status, output, error.count(b"\n")), (2, b"", 1), error)


if __name__ == "__main__":
    unittest.main()
