"""A short run of convergence.py with each recorder that whoever runs this may use; CINDRAL_CONVERGENCE_OPS makes it longer."""

import os
import unittest

import convergence
from recorders import may_use_fanotify


class ConvergenceTest(unittest.TestCase):
    def check(self, recorder):
        operations = os.environ.get("CINDRAL_CONVERGENCE_OPS", "4000")
        self.assertTrue(convergence.check(convergence.arguments(["--ops", operations, "--recorder", recorder])))

    def test_inotify(self):
        self.check("inotify")

    def test_what_is_chosen_where_fanotify_may_be_used_and_where_not(self):
        self.check("fanotify" if may_use_fanotify() else "auto")


if __name__ == "__main__":
    unittest.main()
