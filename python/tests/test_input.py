"""Input: input() and sys.stdin through KxReplGetUserInput, and the strings it hands over."""

import _thread

from .fake_dll import RecordingDll, ServerTestCase

OK, FAILED = 0, 1


class InputTests(ServerTestCase):
    def test_input_returns_the_answer_and_sends_the_prompt(self):
        dll = RecordingDll(answers=["Ada"])
        self.assertEqual(self.run_one("eval", "input('name? ')", dll=dll), (OK, "'Ada'"))
        self.assertEqual([c.args for c in dll.named("KxReplGetUserInput")], [("name? ",)])

    def test_input_without_prompt_sends_an_empty_prompt(self):
        dll = RecordingDll(answers=["x"])
        self.run_one("exec", "input()", dll=dll)
        self.assertEqual([c.args for c in dll.named("KxReplGetUserInput")], [("",)])

    def test_line_end_of_the_answer_is_dropped(self):
        dll = RecordingDll(answers=["one\r\n", "two\n", ""])
        self.assertEqual(self.run_one("eval", "[input(), input(), input()]", dll=dll),
                         (OK, "['one', 'two', '']"))

    def test_no_answer_raises_eof_error(self):
        dll = RecordingDll(answers=[None])
        self.assertEqual(self.run_one("exec", "input('> ')", dll=dll), (FAILED,
            "Traceback (most recent call last):\n"
            '  File "<stdin>", line 1, in <module>\n'
            "EOFError\n"))

    def test_output_so_far_goes_out_before_the_prompt(self):
        dll = RecordingDll(answers=["y"])
        self.run_one("exec", "print('Continue', end='')\nimport sys\nprint('warn', end='', file=sys.stderr)\n"
                             "input('?')", dll=dll)
        names = [c.name for c in dll.calls if c.name in ("KxReplPrint", "KxReplGetUserInput")]
        self.assertEqual(names, ["KxReplPrint", "KxReplPrint", "KxReplGetUserInput"])

    def test_input_on_another_thread_sees_end_of_input(self):
        dll = RecordingDll(answers=["not for threads"])
        source = ("import threading\nseen = []\n"
                  "def ask():\n"
                  "    try:\n        input()\n"
                  "    except EOFError:\n        seen.append('EOFError')\n"
                  "t = threading.Thread(target=ask)\nt.start()\nt.join(10)\nseen")
        self.assertEqual(self.run_one("exec", source, dll=dll), (OK, "['EOFError']"))


class StdinTests(ServerTestCase):
    def test_readline_asks_without_prompt(self):
        dll = RecordingDll(answers=["first"])
        self.assertEqual(self.run_one("eval", "__import__('sys').stdin.readline()", dll=dll),
                         (OK, "'first\\n'"))
        self.assertEqual([c.args for c in dll.named("KxReplGetUserInput")], [(None,)])

    def test_end_of_input_reads_as_empty_string(self):
        dll = RecordingDll(answers=[None])
        self.assertEqual(self.run_one("eval", "__import__('sys').stdin.readline()", dll=dll), (OK, "''"))

    def test_iteration_and_read_stop_at_end_of_input(self):
        dll = RecordingDll(answers=["a", "b", None, "c", "d", None])
        outcomes, _ = self.run_commands(("exec", "import sys\nlist(sys.stdin)"),
                                        ("eval", "sys.stdin.read()"), dll=dll)
        self.assertEqual(outcomes, [(OK, "['a\\n', 'b\\n']"), (OK, "'c\\nd\\n'")])

    def test_limited_reads_keep_the_rest_of_the_line(self):
        dll = RecordingDll(answers=["abcdef"])
        self.assertEqual(self.run_one("eval", "[__import__('sys').stdin.readline(2), "
                                              "__import__('sys').stdin.read(3), "
                                              "__import__('sys').stdin.readline()]", dll=dll),
                         (OK, "['ab', 'cde', 'f\\n']"))


class StringOwnershipTests(ServerTestCase):
    """Every answer string the server hands over is read and then freed exactly once.
    (The test case's cleanup also fails on any string left live or freed twice.)"""

    def test_each_answer_is_freed_once(self):
        dll = RecordingDll(answers=["1", "2", "3", "4", "5"])
        self.run_one("exec", "[input() for _ in range(5)]", dll=dll)
        read = [c.args[0] for c in dll.named("KxReplGetString")]
        freed = [c.args[0] for c in dll.named("KxReplFreeString")]
        self.assertEqual(len(set(read)), 5)
        self.assertEqual(freed, read)

    def test_no_answer_frees_nothing(self):
        dll = RecordingDll(answers=[None])
        self.run_one("exec", "input()", dll=dll)
        self.assertEqual(dll.named("KxReplFreeString"), [])
        self.assertEqual(dll.named("KxReplGetString"), [])

    def test_freed_even_when_reading_it_fails(self):
        dll = RecordingDll(answers=["boom"])
        record = dll.KxReplGetString

        def failing_read(handle):
            record(handle)
            raise OSError("access violation reading the string")

        dll.KxReplGetString = failing_read
        rc, text = self.run_one("exec", "input()", dll=dll)
        self.assertEqual(rc, FAILED)
        self.assertIn("OSError", text)
        self.assertEqual(len(dll.named("KxReplFreeString")), 1)

    def test_interrupt_arriving_with_the_answer_frees_it_and_fails_the_command(self):
        # The client's interrupt comes in just as the answer is handed over.
        dll = RecordingDll(answers=["late answer"])
        dll.on_input = _thread.interrupt_main
        outcomes, _ = self.run_commands(("exec", "x = input()\nreached = True"),
                                        ("eval", "'x' in globals() or 'reached' in globals()"), dll=dll)
        rc, text = outcomes[0]
        self.assertEqual(rc, FAILED)
        self.assertTrue(text.endswith("KeyboardInterrupt\n"), text)
        self.assertEqual(outcomes[1], (OK, "False"))
        self.assertEqual(len(dll.named("KxReplFreeString")), 1)
