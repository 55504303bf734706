"""The command line: arguments, exit statuses, and the wiring of a run (minus Windows)."""

import contextlib
import io
import os
import struct
import subprocess
import sys
import unittest
from unittest import mock

from replserver_host import entry, native

from .fake_dll import RecordingDll

PACKAGE_PARENT = os.path.dirname(os.path.dirname(os.path.abspath(entry.__file__)))


class ArgumentTests(unittest.TestCase):
    def test_three_arguments(self):
        args = entry.parse_arguments(["QUJD", "1234", "5678"])
        self.assertEqual((args.client, args.pid, args.pipe, args.dll), ("QUJD", 1234, 5678, None))

    def test_dll_option(self):
        args = entry.parse_arguments(["--dll", r"C:\x\ReplServer.dll", "QUJD", "1", "2"])
        self.assertEqual(args.dll, r"C:\x\ReplServer.dll")

    def test_largest_values(self):
        args = entry.parse_arguments(["Q", str(2 ** 32 - 1), str(2 ** 64 - 1)])
        self.assertEqual((args.pid, args.pipe), (2 ** 32 - 1, 2 ** 64 - 1))

    def test_bad_command_lines_exit_with_usage_status(self):
        for argv in (["QUJD", "12"], ["QUJD", "0x10", "1"], ["QUJD", "-1", "1"], ["QUJD", "1", " 2"],
                     ["QUJD", "1", "2a"], ["QUJD", str(2 ** 32), "1"], ["QUJD", "1", "\u0663"],
                     ["QUJD", "1", "2", "extra"]):
            with self.subTest(argv=argv), contextlib.redirect_stderr(io.StringIO()) as err:
                with self.assertRaises(SystemExit) as caught:
                    entry.parse_arguments(argv)
                self.assertEqual(caught.exception.code, entry.EXIT_USAGE)
                self.assertIn("usage:", err.getvalue())


class MainTests(unittest.TestCase):
    def test_refuses_to_run_off_windows(self):
        with mock.patch.object(sys, "platform", "linux"), \
                contextlib.redirect_stderr(io.StringIO()) as err:
            self.assertEqual(entry.main(["QUJD", "1", "2"]), entry.EXIT_UNAVAILABLE)
        self.assertIn("Windows", err.getvalue())

    def test_dll_that_does_not_load(self):
        failing = mock.Mock(side_effect=OSError("[WinError 193] %1 is not a valid Win32 application"))
        with mock.patch.object(sys, "platform", "win32"), mock.patch.object(native, "load", failing), \
                contextlib.redirect_stderr(io.StringIO()) as err:
            status = entry.main(["--dll", "other.dll", "QUJD", "1", "2"])
        self.assertEqual(status, entry.EXIT_UNAVAILABLE)
        failing.assert_called_once_with("other.dll")
        self.assertIn("other.dll", err.getvalue())
        self.assertIn("WinError 193", err.getvalue())

    def test_run_result_becomes_the_exit_status_after_draining_messages(self):
        dll = RecordingDll()
        events = []
        dll.client = lambda driver: events.append("run") or 3
        with mock.patch.object(sys, "platform", "win32"), \
                mock.patch.object(native, "load", return_value=dll) as load, \
                mock.patch.object(native, "python_module_handle", return_value=0x1000), \
                mock.patch.object(native, "com_module_handle", return_value=None), \
                mock.patch.object(native, "drain_messages", side_effect=lambda: events.append("drain")):
            status = entry.main(["QUJD", "77", "88"])
        self.assertEqual(status, 3)
        self.assertEqual(events, ["run", "drain"])
        load.assert_called_once_with(native.default_dll_path())
        [run] = dll.named("KxReplRun")
        self.assertEqual(run.args[:5], (b"QUJD", 77, 0x1000, None, 88))
        self.assertEqual(dll.violations, [])


class ModuleCommandTests(unittest.TestCase):
    """`python -m replserver_host` as a client starts it."""

    def run_module(self, *args):
        return subprocess.run([sys.executable, "-m", "replserver_host"] + list(args),
                              cwd=PACKAGE_PARENT, capture_output=True, text=True, timeout=60)

    def test_usage_error_status(self):
        self.assertEqual(self.run_module("QUJD").returncode, entry.EXIT_USAGE)

    @unittest.skipIf(sys.platform == "win32", "checks the refusal off Windows")
    def test_unavailable_status_off_windows(self):
        result = self.run_module("QUJD", "1", "2")
        self.assertEqual(result.returncode, entry.EXIT_UNAVAILABLE)
        self.assertIn("Windows", result.stderr)


class DllLocationTests(unittest.TestCase):
    def setUp(self):
        here = os.path.dirname(os.path.abspath(native.__file__))
        arch = "x64" if struct.calcsize("P") == 8 else "x86"
        self.in_arch_dir = os.path.join(here, arch, native.DLL_NAME)
        self.beside = os.path.join(here, native.DLL_NAME)

    def located_with(self, existing):
        with mock.patch("os.path.isfile", side_effect=lambda path: path in existing):
            return native.default_dll_path()

    def test_prefers_the_folder_of_this_bitness(self):
        self.assertEqual(self.located_with({self.in_arch_dir, self.beside}), self.in_arch_dir)

    def test_falls_back_to_the_package_folder(self):
        self.assertEqual(self.located_with({self.beside}), self.beside)

    def test_names_the_expected_place_when_missing(self):
        self.assertEqual(self.located_with(set()), self.in_arch_dir)
