"""A short run of edits_converge.py with each recorder that whoever runs this may use.

The seed is fixed, so that a run says something of what was changed: it is one that has failed. Others are looked at with edits_converge.py itself.
"""

import unittest

import edits_converge
from recorders import may_use_fanotify


class EditsConvergeTest(unittest.TestCase):
    def check(self, recorder):
        self.assertTrue(edits_converge.run(edits_converge.arguments(["--seed", "3323991133", "--ops", "1500", "--at-once", "1", "--recorder", recorder])))

    def test_inotify(self):
        self.check("inotify")

    def test_what_is_chosen_where_fanotify_may_be_used_and_where_not(self):
        self.check("fanotify" if may_use_fanotify() else "auto")


if __name__ == "__main__":
    unittest.main()
