# Runs one end-to-end test module for CTest.
#
# Exit status: 0 when every test that ran passed, 1 on any failure or error,
# 77 (CTest's SKIP_RETURN_CODE) when every test was skipped, so that a testbed
# that could not get its namespaces shows as skipped, never as passed. Skipped
# tests are listed with their reasons either way.

import os
import sys
import time
import unittest

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))


def main():
    module = sys.argv[1]
    started = time.monotonic()
    suite = unittest.defaultTestLoader.loadTestsFromName(module)
    result = unittest.TextTestRunner(verbosity=2, stream=sys.stdout).run(suite)
    for test, reason in result.skipped:
        print("SKIPPED %s: %s" % (test.id(), reason))
    print("%s: %d run, %d skipped, %.1f s" % (module, result.testsRun, len(result.skipped),
                                             time.monotonic() - started))
    if not result.wasSuccessful():
        return 1
    if result.testsRun > 0 and len(result.skipped) == result.testsRun:
        if os.environ.get("MOX_E2E_REQUIRED"):
            print("MOX_E2E_REQUIRED is set: a skipped testbed counts as a failure")
            return 1
        return 77
    return 0


if __name__ == "__main__":
    sys.exit(main())
