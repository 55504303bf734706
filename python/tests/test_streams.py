"""Output redirection: what reaches KxReplPrint, from which thread, and restoration."""

import builtins
import io
import re
import signal
import sys
from unittest import mock

from replserver_host import streams

from .fake_dll import ServerTestCase

OK, FAILED = 0, 1
WAIT = 10  # seconds any test waits for a thread at most


def main_namespace():
    """The command namespace, reachable from the client while the run lasts."""
    return sys.modules["__main__"].__dict__


class OutputTests(ServerTestCase):
    def prints(self, dll):
        return [(c.args[0], bool(c.args[1])) for c in dll.named("KxReplPrint")]

    def test_stdout_and_stderr_are_told_apart(self):
        _, dll = self.run_commands(("exec", "import sys\nprint('out')\nprint('err', file=sys.stderr)"))
        self.assertEqual(self.prints(dll), [("out\n", False), ("err\n", True)])
        self.assertEqual({c.args[1] for c in dll.named("KxReplPrint")}, {0, 1})

    def test_a_line_goes_out_whole(self):
        _, dll = self.run_commands(("exec", "print('a', 'b', 3, sep='-')"))
        self.assertEqual(self.prints(dll), [("a-b-3\n", False)])

    def test_several_lines_in_one_write_go_out_together(self):
        _, dll = self.run_commands(("exec", "import sys\nsys.stdout.write('1\\n2\\n3')"))
        self.assertEqual(self.prints(dll), [("1\n2\n", False), ("3", False)])

    def test_unfinished_line_goes_out_before_the_result(self):
        outcomes, dll = self.run_commands(("exec", "print('no end', end='')\n5"))
        self.assertEqual(outcomes, [(OK, "5")])
        names = [c.name for c in dll.calls if c.name in ("KxReplPrint", "KxReplSetResult")]
        self.assertEqual(names, ["KxReplPrint", "KxReplSetResult"])
        self.assertEqual(dll.printed(), "no end")

    def test_unfinished_line_goes_out_when_the_command_fails(self):
        outcomes, dll = self.run_commands(("exec", "print('half', end='')\n1/0"))
        self.assertEqual(outcomes[0][0], FAILED)
        self.assertEqual(dll.printed(), "half")

    def test_flush_sends_the_unfinished_line(self):
        _, dll = self.run_commands(("exec", "print('x', end='', flush=True)\nprint('y')"))
        self.assertEqual(self.prints(dll), [("x", False), ("y\n", False)])

    def test_carriage_return_ends_a_progress_line(self):
        _, dll = self.run_commands(("exec", "import sys\nsys.stdout.write('10%\\r')\nsys.stdout.write('20%\\r')"))
        self.assertEqual(self.prints(dll), [("10%\r", False), ("20%\r", False)])

    def test_overlong_unfinished_line_goes_out_at_once(self):
        count = streams.MAX_UNFINISHED + 10

        def client(driver):
            main_namespace()["dll"] = driver.dll
            return driver.exec("exec", "import sys\nsys.stdout.write('z' * %d)\n"
                                       "len(dll.named('KxReplPrint'))" % count)

        dll, outcome = self.serve(client)
        self.assertEqual(outcome, (OK, "1"))
        self.assertEqual(self.prints(dll), [("z" * count, False)])

    def test_empty_writes_call_nothing(self):
        _, dll = self.run_commands(("exec", "import sys\nsys.stdout.write('')\nprint(end='')"))
        self.assertEqual(dll.named("KxReplPrint"), [])

    def test_non_text_is_refused(self):
        rc, text = self.run_one("exec", "import sys\nsys.stdout.write(b'bytes')")
        self.assertEqual(rc, FAILED)
        self.assertIn("TypeError", text)

    def test_print_inside_a_nested_command(self):
        # While the main thread waits in a print, the client may send another command.
        def client(driver):
            def on_print(text, is_error):
                if text == "outer\n":
                    nested.append(driver.exec("exec", "print('inner')\n'nested'"))
            driver.dll.on_print = on_print
            return driver.exec("exec", "print('outer')\nprint('after')")

        nested = []
        dll, outer = self.serve(client)
        self.assertEqual(outer, (OK, ""))
        self.assertEqual(nested, [(OK, "'nested'")])
        self.assertEqual(dll.printed(), "outer\ninner\nafter\n")


class ThreadOutputTests(ServerTestCase):
    def test_each_thread_keeps_its_order_and_whole_lines(self):
        source = (
            "import threading\n"
            "def worker(n):\n"
            "    for i in range(60):\n"
            "        print('thread', n, 'line', i)\n"
            "threads = [threading.Thread(target=worker, args=(n,)) for n in range(4)]\n"
            "for t in threads: t.start()\n"
            "for t in threads: t.join(%d)\n"
            "sum(t.is_alive() for t in threads)" % WAIT)
        outcomes, dll = self.run_commands(("exec", source))
        self.assertEqual(outcomes, [(OK, "0")])
        by_worker = {}
        for call in dll.named("KxReplPrint"):
            match = re.fullmatch(r"thread (\d) line (\d+)\n", call.args[0])
            self.assertIsNotNone(match, "not one whole line: %r" % call.args[0])
            self.assertNotEqual(call.thread, dll.main_thread)
            by_worker.setdefault(match.group(1), []).append((call.thread, int(match.group(2))))
        self.assertEqual(sorted(by_worker), ["0", "1", "2", "3"])
        for lines in by_worker.values():
            self.assertEqual([number for _, number in lines], list(range(60)))
            self.assertEqual(len({thread for thread, _ in lines}), 1)

    def test_thread_printing_between_commands_reaches_the_server(self):
        def client(driver):
            driver.exec("exec", "import threading\n"
                                "go, done = threading.Event(), threading.Event()\n"
                                "def late():\n"
                                "    go.wait(%d)\n"
                                "    print('late line')\n"
                                "    done.set()\n"
                                "threading.Thread(target=late).start()" % WAIT)
            namespace = main_namespace()
            namespace["go"].set()
            return namespace["done"].wait(WAIT)

        dll, finished = self.serve(client)
        self.assertTrue(finished)
        [call] = dll.named("KxReplPrint")
        self.assertEqual(call.args[0], "late line\n")
        self.assertNotEqual(call.thread, dll.main_thread)

    def test_thread_printing_after_the_run_uses_the_original_stream(self):
        namespace = {}

        def client(driver):
            driver.exec("exec", "import threading\n"
                                "go = threading.Event()\n"
                                "def after():\n"
                                "    go.wait(%d)\n"
                                "    print('after the run')\n"
                                "worker = threading.Thread(target=after)\n"
                                "worker.start()" % WAIT)
            namespace.update(main_namespace())
            return 0

        with mock.patch("sys.stdout", new_callable=io.StringIO) as original:
            dll, _ = self.serve(client)
            namespace["go"].set()
            namespace["worker"].join(WAIT)
            self.assertFalse(namespace["worker"].is_alive())
        self.assertEqual(original.getvalue(), "after the run\n")
        self.assertEqual(dll.named("KxReplPrint"), [])

    def test_unfinished_line_of_another_thread_is_kept_for_after_the_run(self):
        def client(driver):
            return driver.exec("exec", "import threading\n"
                                       "t = threading.Thread(target=print, args=('tail',), kwargs={'end': ''})\n"
                                       "t.start()\n"
                                       "t.join(%d)" % WAIT)

        with mock.patch("sys.stdout", new_callable=io.StringIO) as original:
            dll, outcome = self.serve(client)
        self.assertEqual(outcome, (OK, ""))
        self.assertEqual(original.getvalue(), "tail")
        self.assertEqual(dll.named("KxReplPrint"), [])


class RestorationTests(ServerTestCase):
    def current(self):
        return (sys.stdout, sys.stderr, sys.stdin, builtins.input,
                signal.getsignal(signal.SIGINT), sys.modules["__main__"])

    def test_installed_during_the_run_and_restored_after(self):
        before = self.current()
        seen = []

        def client(driver):
            seen.append(self.current())
            driver.exec("exec", "print('between')")
            seen.append(self.current())
            return 0

        self.serve(client)
        self.assertEqual(self.current(), before)
        for during in seen:
            for old, new in zip(before, during):
                self.assertIsNot(old, new)
        self.assertEqual(seen[0], seen[1], "replacements changed between commands")

    def test_restored_when_the_run_raises(self):
        before = self.current()

        def client(driver):
            raise RuntimeError("client went away")

        with self.assertRaises(RuntimeError):
            self.serve(client)
        self.assertEqual(self.current(), before)

    def test_restores_what_user_code_replaced(self):
        before = self.current()
        self.run_commands(("exec", "import sys, io\nsys.stdout = io.StringIO()\nsys.stdin = None"))
        self.assertEqual(self.current(), before)
