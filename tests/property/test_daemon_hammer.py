"""A short run of daemon_hammer.py."""

import unittest

import daemon_hammer


class DaemonHammerTest(unittest.TestCase):
    def test_eight_clients_at_once(self):
        count = daemon_hammer.run(daemon_hammer.arguments(["--rounds", "20", "--seed", "20261121"]))
        self.assertGreaterEqual(sum(count.values()), 8 * 20 * daemon_hammer.AT_ONCE)


if __name__ == "__main__":
    unittest.main()
