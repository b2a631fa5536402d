"""A short run of daemon_kills.py."""

import unittest

import daemon_kills


class DaemonKillsTest(unittest.TestCase):
    def test_nothing_is_lost_and_every_anchor_converges(self):
        told = daemon_kills.run(daemon_kills.arguments(["--kills", "5", "--edits", "60", "--seed", "20261121"]))
        self.assertEqual(told.expired, 0)


if __name__ == "__main__":
    unittest.main()
