"""The C side of the contract: KxReplRun's arguments and the ExecComProc reference rules."""

import ctypes
import sys
import threading

from replserver_host.callbacks import EXEC_COM_PROC, EXEC_PROC
from replserver_host.server import run_server

from .fake_dll import (CLIENT_PID, CLIENT_TEXT, COM_MODULE, PIPE_HANDLE, PYTHON_MODULE,
                       ServerTestCase)

OK, FAILED = 0, 1


class RunArgumentTests(ServerTestCase):
    def test_arguments_in_order(self):
        dll, _ = self.serve(lambda driver: 0)
        [run] = dll.named("KxReplRun")
        self.assertEqual(run.args[:5], (CLIENT_TEXT.encode("ascii"), CLIENT_PID, PYTHON_MODULE,
                                        COM_MODULE, PIPE_HANDLE))
        self.assertIsInstance(run.args[5], EXEC_PROC)
        self.assertIsInstance(run.args[6], EXEC_COM_PROC)
        self.assertTrue(run.args[5])
        self.assertTrue(run.args[6])

    def test_without_com_support_the_com_callback_is_null(self):
        dll, _ = self.serve(lambda driver: 0, com=False)
        [run] = dll.named("KxReplRun")
        self.assertIsNone(run.args[3])
        self.assertIsNone(ctypes.cast(run.args[6], ctypes.c_void_p).value)
        self.assertTrue(run.args[5])

    def test_result_of_the_run_is_returned(self):
        for result in (0, 2, 3):
            _, returned = self.serve(lambda driver: result)
            self.assertEqual(returned, result)

    def test_must_run_on_the_main_thread(self):
        errors = []

        def serve_from_thread():
            try:
                run_server(None, CLIENT_TEXT, CLIENT_PID, PIPE_HANDLE, PYTHON_MODULE, None)
            except RuntimeError as exc:
                errors.append(exc)

        worker = threading.Thread(target=serve_from_thread)
        worker.start()
        worker.join(10)
        self.assertEqual(len(errors), 1)


class ExecComTests(ServerTestCase):
    """ExecComProc: a borrowed argument object in, a new reference to the result out."""

    def serve_com(self, client):
        _, outcome = self.serve(client)
        return outcome

    def test_eval_hands_over_a_new_reference_to_the_object_itself(self):
        def client(driver):
            driver.exec("exec", "class Marker:\n    pass\nmarker = Marker()")
            marker = sys.modules["__main__"].marker
            before = sys.getrefcount(marker)
            rc, slot = driver.exec_com_raw("eval", "marker")
            handed_over = sys.getrefcount(marker) - before
            ctypes.pythonapi.Py_DecRef(ctypes.py_object(marker))  # what the server does
            return rc, slot.value == id(marker), handed_over, sys.getrefcount(marker) - before

        self.assertEqual(self.serve_com(client), (OK, True, 1, 0))

    def test_argument_reference_stays_the_servers(self):
        def client(driver):
            argument = "".join(["1 + ", "1"])  # an object of its own, not a shared constant
            before = sys.getrefcount(argument)
            rc, value = driver.exec_com("eval", argument)
            return rc, value, sys.getrefcount(argument) - before

        self.assertEqual(self.serve_com(client), (OK, 2, 0))

    def test_exec_gives_the_final_value_or_none(self):
        def client(driver):
            first = driver.exec_com("exec", "values = [1, 'two']\nvalues")
            rc, slot = driver.exec_com_raw("exec", "x = 1")
            return first, rc, slot.value == id(None)

        (rc, value), rc_none, holds_none = self.serve_com(client)
        self.assertEqual((rc, value), (OK, [1, "two"]))
        self.assertEqual((rc_none, holds_none), (OK, True))

    def test_complete_gives_a_tuple(self):
        def client(driver):
            driver.exec("exec", "alpha_one = alpha_two = 0")
            return driver.exec_com("complete", "alpha_")

        self.assertEqual(self.serve_com(client), (OK, ("alpha_one", "alpha_two")))

    def test_failure_hands_over_the_traceback_text(self):
        rc, text = self.serve_com(lambda driver: driver.exec_com("eval", "1 / 0"))
        self.assertEqual(rc, FAILED)
        self.assertEqual(text, "Traceback (most recent call last):\n"
                               '  File "<stdin>", line 1, in <module>\n'
                               "ZeroDivisionError: division by zero\n")

    def test_non_text_argument_fails_clearly(self):
        rc, text = self.serve_com(lambda driver: driver.exec_com("exec", 42))
        self.assertEqual(rc, FAILED)
        self.assertIn("'exec'", text)
        self.assertIn("int", text)

    def test_empty_argument_counts_as_empty_text(self):
        def client(driver):
            rc, slot = driver.exec_com_raw("exec", None)  # VT_EMPTY arrives as None
            return rc, slot.value == id(None)

        self.assertEqual(self.serve_com(client), (OK, True))

    def test_shares_the_namespace_with_exec(self):
        def client(driver):
            driver.exec_com("exec", "shared = {'k': 1}")
            return driver.exec("eval", "shared['k']")

        self.assertEqual(self.serve_com(client), (OK, "1"))
