"""A short run of edits_race.py."""

import unittest

import edits_race


class EditsRaceTest(unittest.TestCase):
    def test_two_clients_that_want_the_same_names(self):
        self.assertTrue(edits_race.run(edits_race.arguments(["--seed", "1", "--ops", "3000"])))


if __name__ == "__main__":
    unittest.main()
