"""Failure texts: the traceback as the interactive console prints it."""

from .fake_dll import ServerTestCase

OK, FAILED = 0, 1


class TracebackShapeTests(ServerTestCase):
    def test_error_in_a_single_statement(self):
        self.assertEqual(self.run_one("exec", "1 / 0"), (FAILED,
            "Traceback (most recent call last):\n"
            '  File "<stdin>", line 1, in <module>\n'
            "ZeroDivisionError: division by zero\n"))

    def test_error_in_eval(self):
        self.assertEqual(self.run_one("eval", "{}['key']"), (FAILED,
            "Traceback (most recent call last):\n"
            '  File "<stdin>", line 1, in <module>\n'
            "KeyError: 'key'\n"))

    def test_error_in_a_function_from_an_earlier_command(self):
        outcomes, _ = self.run_commands(
            ("exec", "def outer():\n    inner()\n\ndef inner():\n    raise ValueError('deep')"),
            ("exec", "x = 1\nouter()"))
        self.assertEqual(outcomes[1], (FAILED,
            "Traceback (most recent call last):\n"
            '  File "<stdin>", line 2, in <module>\n'
            '  File "<stdin>", line 2, in outer\n'
            '  File "<stdin>", line 5, in inner\n'
            "ValueError: deep\n"))

    def test_error_in_the_final_expression_keeps_its_line(self):
        rc, text = self.run_one("exec", "a = 1\nb = 2\na + undefined_name_q")
        self.assertEqual(rc, FAILED)
        self.assertIn('  File "<stdin>", line 3, in <module>\n', text)

    def test_syntax_error_has_no_traceback_header(self):
        rc, text = self.run_one("exec", "x = (1 +")
        self.assertEqual(rc, FAILED)
        self.assertTrue(text.startswith('  File "<stdin>", line 1\n'), text)
        self.assertTrue(text.endswith("\n"), text)
        self.assertTrue(text.splitlines()[-1].startswith("SyntaxError: "), text)

    def test_chained_exceptions_are_shown(self):
        rc, text = self.run_one("exec", "try:\n    1 / 0\nexcept ZeroDivisionError:\n    raise KeyError('k')")
        self.assertEqual(rc, FAILED)
        self.assertIn("ZeroDivisionError: division by zero\n", text)
        self.assertIn("During handling of the above exception, another exception occurred:", text)
        self.assertTrue(text.endswith("KeyError: 'k'\n"), text)

    def test_frames_of_library_code_are_kept(self):
        rc, text = self.run_one("exec", "import json\njson.loads('{')")
        self.assertEqual(rc, FAILED)
        self.assertIn('  File "<stdin>", line 2, in <module>\n', text)
        self.assertIn("json", text.split('File "<stdin>"', 2)[-1])

    def test_the_package_itself_never_appears(self):
        outcomes, _ = self.run_commands(("exec", "1 / 0"), ("eval", "nope_zz"), ("exec", "def"))
        for rc, text in outcomes:
            self.assertEqual(rc, FAILED)
            self.assertNotIn("replserver_host", text)


class KeyboardInterruptTests(ServerTestCase):
    def test_fails_the_command_with_its_traceback(self):
        self.assertEqual(self.run_one("exec", "raise KeyboardInterrupt"), (FAILED,
            "Traceback (most recent call last):\n"
            '  File "<stdin>", line 1, in <module>\n'
            "KeyboardInterrupt\n"))

    def test_next_command_runs_normally(self):
        outcomes, _ = self.run_commands(("exec", "raise KeyboardInterrupt"), ("eval", "1"))
        self.assertEqual(outcomes[1], (OK, "1"))

    def test_interrupt_through_the_com_callback_fails_too(self):
        def client(driver):
            return driver.exec_com("exec", "raise KeyboardInterrupt")

        _, (rc, text) = self.serve(client)
        self.assertEqual(rc, FAILED)
        self.assertTrue(text.endswith("KeyboardInterrupt\n"), text)
