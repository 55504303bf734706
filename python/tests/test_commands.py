"""The client-facing commands: exec, eval, complete, and what else a client may send."""

import builtins

from .fake_dll import ServerTestCase

OK, FAILED = 0, 1


class ExecTests(ServerTestCase):
    def test_state_persists_between_commands(self):
        outcomes, _ = self.run_commands(("exec", "x = 20"), ("exec", "def twice(v):\n    return 2 * v"),
                                        ("eval", "twice(x) + 2"))
        self.assertEqual(outcomes, [(OK, ""), (OK, ""), (OK, "42")])

    def test_final_expression_gives_its_repr(self):
        self.assertEqual(self.run_one("exec", "a = 'spam'\na.upper()"), (OK, "'SPAM'"))

    def test_final_expression_none_gives_empty_result(self):
        self.assertEqual(self.run_one("exec", "None"), (OK, ""))

    def test_expression_before_the_last_statement_is_not_the_result(self):
        self.assertEqual(self.run_one("exec", "1 + 1\ny = 3"), (OK, ""))

    def test_compound_statement_runs_like_exec(self):
        outcomes, dll = self.run_commands(("exec", "for i in range(3):\n    print(i)"), ("eval", "i"))
        self.assertEqual(outcomes, [(OK, ""), (OK, "2")])
        self.assertEqual(dll.printed(), "0\n1\n2\n")

    def test_final_expression_not_evaluated_after_a_failure(self):
        outcomes, _ = self.run_commands(("exec", "hits = []"),
                                        ("exec", "1 / 0\nhits.append(1)"), ("eval", "hits"))
        self.assertEqual(outcomes[1][0], FAILED)
        self.assertEqual(outcomes[2], (OK, "[]"))

    def test_displayed_value_becomes_underscore(self):
        saved = builtins.__dict__.get("_")
        self.addCleanup(lambda: setattr(builtins, "_", saved))
        outcomes, _ = self.run_commands(("exec", "6 * 7"), ("eval", "_ + 1"))
        self.assertEqual(outcomes, [(OK, "42"), (OK, "43")])

    def test_namespace_is_the_main_module(self):
        outcomes, _ = self.run_commands(
            ("exec", "import __main__, pickle\nclass Point:\n    pass"),
            ("eval", "__name__"),
            ("eval", "__main__.Point is Point"),
            ("eval", "type(pickle.loads(pickle.dumps(Point()))) is Point"))
        self.assertEqual(outcomes[1:], [(OK, "'__main__'"), (OK, "True"), (OK, "True")])

    def test_future_import_stays_in_force(self):
        outcomes, _ = self.run_commands(
            ("exec", "from __future__ import annotations"),
            ("exec", "def f(x: not_defined_anywhere): pass\nf.__annotations__"))
        self.assertEqual(outcomes[1], (OK, "{'x': 'not_defined_anywhere'}"))

    def test_missing_argument_counts_as_empty_text(self):
        self.assertEqual(self.run_one("exec", None), (OK, ""))


class EvalTests(ServerTestCase):
    def test_gives_repr(self):
        outcomes, _ = self.run_commands(("eval", "'a' * 3"), ("eval", "None"), ("eval", "[1, (2,)]"))
        self.assertEqual(outcomes, [(OK, "'aaa'"), (OK, "None"), (OK, "[1, (2,)]")])

    def test_ignores_leading_blanks(self):
        self.assertEqual(self.run_one("eval", "  \t1 + 1"), (OK, "2"))

    def test_statement_is_a_syntax_error(self):
        rc, text = self.run_one("eval", "x = 1")
        self.assertEqual(rc, FAILED)
        self.assertTrue(text.rstrip().splitlines()[-1].startswith("SyntaxError"), text)

    def test_failing_repr_fails_the_command(self):
        outcomes, _ = self.run_commands(
            ("exec", "class Bad:\n    def __repr__(self):\n        raise ValueError('no repr')"),
            ("eval", "Bad()"))
        rc, text = outcomes[1]
        self.assertEqual(rc, FAILED)
        self.assertTrue(text.endswith("ValueError: no repr\n"), text)


class CompleteTests(ServerTestCase):
    def complete(self, prefix, setup="pass"):
        outcomes, _ = self.run_commands(("exec", setup), ("complete", prefix))
        self.assertEqual(outcomes[1][0], OK)
        return outcomes[1][1].split("\n") if outcomes[1][1] else []

    def test_names_in_the_namespace(self):
        self.assertEqual(self.complete("my_v", "my_variable = 1\nmy_value = 2"),
                         ["my_value", "my_variable"])

    def test_callables_end_with_parenthesis(self):
        self.assertIn("print(", self.complete("pri"))

    def test_attributes(self):
        self.assertIn("os.path", self.complete("os.pa", "import os"))

    def test_only_the_last_word_is_completed(self):
        self.assertEqual(self.complete("total = len(my_v", "my_variable = 1"),
                         ["total = len(my_variable"])

    def test_no_candidates(self):
        self.assertEqual(self.complete("zzz_nothing_"), [])
        self.assertEqual(self.complete("x = "), [])


class UnknownCommandTests(ServerTestCase):
    def test_fails_with_a_clear_text(self):
        rc, text = self.run_one("run", "1")
        self.assertEqual(rc, FAILED)
        self.assertIn("'run'", text)
        for known in ("exec", "eval", "complete"):
            self.assertIn(known, text)
        self.assertNotIn("Traceback", text)

    def test_commands_are_case_sensitive(self):
        self.assertEqual(self.run_one("EVAL", "1")[0], FAILED)


class ExitTests(ServerTestCase):
    def test_system_exit_quits_the_run_after_the_command(self):
        outcomes, dll = self.run_commands(("exec", "print('bye')\nraise SystemExit(3)"))
        self.assertEqual(outcomes, [(OK, "")])
        self.assertEqual(len(dll.named("KxReplQuit")), 1)
        self.assertEqual(dll.printed(), "bye\n")

    def test_other_commands_do_not_quit(self):
        _, dll = self.run_commands(("exec", "1"), ("eval", "1/0"), ("nope", None))
        self.assertEqual(dll.named("KxReplQuit"), [])
