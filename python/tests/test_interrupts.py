"""The server's interrupt (SIGINT on the main thread): which code it stops, and when."""

import _thread
import signal
import sys
import threading
import unittest

from replserver_host import interrupts
from replserver_host.interrupts import InterruptGate

from .fake_dll import RecordingDll, ServerTestCase

OK, FAILED = 0, 1
WAIT = 10


@interrupts.command_scope
def in_command(action):
    return action()


@interrupts.shielded
def in_shielded(action):
    return action()


def plain(action):
    return action()


class GateDecisionTests(unittest.TestCase):
    def setUp(self):
        self.gate = InterruptGate()

    def interrupt_here(self):
        self.gate(signal.SIGINT, sys._getframe(1))

    def test_inside_a_command_raises(self):
        with self.assertRaises(KeyboardInterrupt):
            in_command(lambda: plain(self.interrupt_here))

    def test_outside_any_command_is_dropped(self):
        plain(self.interrupt_here)
        self.gate(signal.SIGINT, None)
        self.gate.raise_pending()  # nothing was deferred either

    def test_inside_a_shielded_call_waits_until_asked(self):
        in_command(lambda: in_shielded(self.interrupt_here))
        with self.assertRaises(KeyboardInterrupt):
            self.gate.raise_pending()
        self.gate.raise_pending()  # only once

    def test_innermost_mark_decides(self):
        with self.assertRaises(KeyboardInterrupt):
            in_shielded(lambda: in_command(self.interrupt_here))

    def test_clear_pending_forgets_a_deferred_interrupt(self):
        in_shielded(self.interrupt_here)
        self.gate.clear_pending()
        self.gate.raise_pending()

    def test_installed_as_sigint_handler_while_entered(self):
        before = signal.getsignal(signal.SIGINT)
        with self.gate:
            self.assertIs(signal.getsignal(signal.SIGINT), self.gate)
        self.assertIs(signal.getsignal(signal.SIGINT), before)

    def test_refuses_threads_other_than_main(self):
        errors = []

        def enter():
            try:
                with InterruptGate():
                    pass
            except RuntimeError as exc:
                errors.append(exc)

        worker = threading.Thread(target=enter)
        worker.start()
        worker.join(WAIT)
        self.assertEqual(len(errors), 1)


class ServerInterruptTests(ServerTestCase):
    def test_running_command_is_interrupted(self):
        def client(driver):
            driver.exec("exec", "import threading, time\nstarted = threading.Event()")
            started = sys.modules["__main__"].started

            def interrupt_once_started():
                if started.wait(WAIT):
                    _thread.interrupt_main()  # what the server's PyErr_SetInterrupt does

            threading.Thread(target=interrupt_once_started).start()
            # Spins for 10 s at most, so that a lost interrupt fails instead of hanging.
            return driver.exec("exec", "started.set()\n"
                                       "deadline = time.monotonic() + %d\n"
                                       "while time.monotonic() < deadline:\n"
                                       "    pass\n"
                                       "'not interrupted'" % WAIT)

        _, (rc, text) = self.serve(client)
        self.assertEqual(rc, FAILED)
        # The loop, on line 3 or 4 depending on the Python version.
        self.assertRegex(text, r'\ATraceback \(most recent call last\):\n'
                               r'  File "<stdin>", line [34], in <module>\n'
                               r'KeyboardInterrupt\n\Z')

    def test_interrupt_during_a_print_fails_the_command_without_package_frames(self):
        dll = RecordingDll()
        dll.on_print = lambda text, is_error: _thread.interrupt_main()
        rc, text = self.run_one("exec", "print('one')\nprint('two')", dll=dll)
        self.assertEqual(rc, FAILED)
        self.assertTrue(text.endswith("KeyboardInterrupt\n"), text)
        self.assertNotIn("replserver_host", text)
        self.assertEqual(dll.printed(), "one\n")

    def test_late_interrupt_between_commands_is_dropped(self):
        def client(driver):
            first = driver.exec("eval", "1")
            _thread.interrupt_main()
            sum(range(1000))  # Python code on the main thread, where a pending signal is handled
            return first, driver.exec("eval", "2")

        _, outcomes = self.serve(client)
        self.assertEqual(outcomes, ((OK, "1"), (OK, "2")))

    def test_interrupt_after_the_command_finished_keeps_its_result(self):
        dll = RecordingDll()
        store = dll.KxReplSetResult

        def store_then_interrupt(slot, text):
            store(slot, text)
            _thread.interrupt_main()
            sum(range(1000))

        dll.KxReplSetResult = store_then_interrupt
        outcomes, _ = self.run_commands(("eval", "'done'"), ("eval", "'next'"), dll=dll)
        self.assertEqual(outcomes, [(OK, "'done'"), (OK, "'next'")])
