# Signals sent to the real daemon: which are consumed, which stop it, and when
# it may exit (never before its first 10 seconds are over).

import signal
import time

from testbed import BedTestCase, run_in_parallel

PROCEEDING = b"Proceeding with loading mox ..\n"


class SignalTest(BedTestCase):

    def test_signals(self):
        # Every bed runs on its own thread so that the suite waits the
        # daemon's 10 seconds once, not once per signal.
        # name -> (signals sent at (seconds after start, signal),
        #          expected status, or None for "still running")
        cases = {
            "SIGTERM": ([(1.0, signal.SIGTERM)], 0),
            "SIGINT": ([(1.0, signal.SIGINT)], 0),
            "SIGQUIT": ([(1.0, signal.SIGQUIT)], 0),
            "SIGPWR": ([(1.0, signal.SIGPWR)], 0),
            "consumed, then SIGTERM": ([(1.0, signal.SIGHUP), (1.3, signal.SIGCHLD), (1.6, signal.SIGPIPE),
                                         (2.5, signal.SIGTERM)], 0),
            "consumed only": ([(1.0, signal.SIGHUP), (1.3, signal.SIGCHLD), (1.6, signal.SIGPIPE)], None),
            "SIGTERM after the first 10 s": ([(11.0, signal.SIGTERM)], 0),
            # Not in the waited set: the default action, which ends the process.
            "SIGUSR1": ([(1.0, signal.SIGUSR1)], -signal.SIGUSR1),
        }
        horizon = 13.0  # seconds after start when running beds are looked at

        def case(name, sends, expected):
            def check():
                bed = self.bed("signals")
                mox = bed.start_mox()
                self.assertTrue(mox.stdout.wait_for(PROCEEDING, 10), name)
                start = mox.stdout.first_arrival  # the first line comes before the 10 s sleep
                last_sent = start
                for at, number in sends:
                    time.sleep(max(0.0, start + at - time.monotonic()))
                    self.assertTrue(mox.running(), "%s: ended before %s" % (name, number.name))
                    mox.signal(number)
                    last_sent = time.monotonic()
                status = mox.wait(max(0.0, start + horizon - time.monotonic()))
                self.assertEqual(status, expected, "%s: stderr %r" % (name, mox.stderr.data))
                if expected == 0:
                    lived = mox.ended - start
                    self.assertGreaterEqual(lived, 9.9, "%s: exited %.2f s after start" % (name, lived))
                    # Once the 10 s are over the stop is prompt.
                    self.assertLess(mox.ended - max(last_sent, start + 10.0), 2.0, name)
                    self.assertEqual(mox.stderr.data, b"", name)
                if expected is not None and expected < 0:
                    self.assertLess(mox.ended - last_sent, 2.0, name)
            return check

        run_in_parallel([case(name, *c) for name, c in cases.items()])


if __name__ == "__main__":
    import unittest
    unittest.main()
