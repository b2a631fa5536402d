"""The program that looks for what is missed: does it find it, and nothing else?"""

import unittest

import convergence


class ModelTest(unittest.TestCase):
    def check(self, *words):
        return convergence.check(convergence.arguments(["--model", "--ops", "1200", "--size", "150", *words]))

    def test_a_host_that_compares_listings_converges(self):
        for seed in ("1", "2"):
            self.assertTrue(self.check("--seed", seed))

    def test_one_change_of_many_that_is_lost_is_found(self):
        for seed in ("1", "2"):
            self.assertFalse(self.check("--seed", seed, "--loses-every", "500"))

    def test_a_seed_makes_the_same_operations(self):
        told = []
        for _ in range(2):
            options = convergence.arguments(["--model", "--seed", "4"])
            with convergence.temporary_folder(None) as folder:
                run = convergence.Convergence(options, folder)
                told.append([run.operations.run().replace(folder, "") for _ in range(500)])
                run.tree.verify()
        self.assertEqual(told[0], told[1])


if __name__ == "__main__":
    unittest.main()
