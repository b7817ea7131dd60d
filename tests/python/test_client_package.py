"""The Python client of tenond as a package: its pyproject.toml describes the
module that is really there, a wheel built from it installs a working
tenon-client command that talks to a real daemon, and without cbor2 the
client says what to install instead of failing with a traceback.

Run by CTest with the system interpreter (the one scripts/setup gives
python3-cbor2) and these variables:
  TENON_SOURCE_DIR  the source tree
  TENON_VERSION     the project's version (CMake's)
  TENOND            the daemon to run the installed client against
"""

import importlib.util
import os
import shutil
import socket
import subprocess
import sys
import tempfile
import time
import tomllib
import unittest
import zipfile

SOURCE_DIR = os.environ["TENON_SOURCE_DIR"]
CLIENT_DIR = os.path.join(SOURCE_DIR, "examples", "python")
CLIENT = os.path.join(CLIENT_DIR, "tenon_client.py")
PLUGIN = os.path.join(CLIENT_DIR, "upcase_plugin.py")
MATCH_V1 = '{"request":"match","version":1}'


def run(command, env=None, timeout=60):
    return subprocess.run(command, env=env, capture_output=True, text=True, timeout=timeout)


def environment(**changes):
    env = dict(os.environ)
    env.update(changes)
    return env


class Daemon:
    """tenond on a private platform root, listening under `service`."""

    def __init__(self, service):
        self.root = tempfile.mkdtemp(prefix="tenon-py-")
        os.makedirs(os.path.join(self.root, "usr/share/tenon/extension-points"))
        self.socket_path = os.path.join(self.root, "run/tenon/relay", service)
        self.log = open(os.path.join(self.root, "tenond.log"), "w+")
        self.process = subprocess.Popen([os.environ["TENOND"], "-S", service],
                                        env=environment(TENON_ROOT=self.root),
                                        stdout=self.log, stderr=subprocess.STDOUT)
        self._await_listening()

    def _await_listening(self):
        # The socket file appears before listen(); a connection that
        # succeeds is the sign that the daemon serves.
        deadline = time.monotonic() + 30
        while time.monotonic() < deadline:
            if self.process.poll() is not None:
                raise AssertionError(f"tenond exited with {self.process.returncode}: {self.output()}")
            with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as probe:
                try:
                    probe.connect(self.socket_path)
                    return
                except OSError:
                    pass
            time.sleep(0.02)
        raise AssertionError(f"tenond did not listen on {self.socket_path}: {self.output()}")

    def output(self):
        self.log.seek(0)
        return self.log.read()

    def stop(self):
        self.process.terminate()
        self.process.wait(timeout=30)
        self.log.close()
        shutil.rmtree(self.root, ignore_errors=True)


class PyprojectTest(unittest.TestCase):
    def setUp(self):
        with open(os.path.join(CLIENT_DIR, "pyproject.toml"), "rb") as file:
            self.project = tomllib.load(file)

    def test_describes_the_module_and_command_that_exist(self):
        modules = self.project["tool"]["setuptools"]["py-modules"]
        self.assertEqual(modules, ["tenon_client"])
        for module in modules:
            self.assertTrue(os.path.isfile(os.path.join(CLIENT_DIR, module + ".py")), module)
        target = self.project["project"]["scripts"]["tenon-client"]
        module_name, function = target.split(":")
        spec = importlib.util.spec_from_file_location(module_name, CLIENT)
        module = importlib.util.module_from_spec(spec)
        spec.loader.exec_module(module)
        self.assertTrue(callable(getattr(module, function)), target)

    def test_version_follows_the_project(self):
        self.assertEqual(self.project["project"]["version"], os.environ["TENON_VERSION"])

    def test_depends_on_cbor2_and_ships_its_readme(self):
        self.assertTrue(any(d.startswith("cbor2") for d in self.project["project"]["dependencies"]))
        self.assertTrue(os.path.isfile(os.path.join(CLIENT_DIR, self.project["project"]["readme"])))


class MissingCbor2Test(unittest.TestCase):
    """cbor2 hidden behind a module of that name that fails to import, as a
    machine without python3-cbor2 would."""

    def setUp(self):
        self.shadow = tempfile.mkdtemp(prefix="no-cbor2-")
        with open(os.path.join(self.shadow, "cbor2.py"), "w") as file:
            file.write("raise ModuleNotFoundError(\"No module named 'cbor2'\", name='cbor2')\n")
        self.env = environment(PYTHONPATH=self.shadow)

    def tearDown(self):
        shutil.rmtree(self.shadow, ignore_errors=True)

    def assertNamesWhatToInstall(self, result):
        self.assertNotEqual(result.returncode, 0)
        self.assertNotIn("Traceback", result.stderr)
        self.assertIn("python3-cbor2", result.stderr)
        self.assertIn("pip install cbor2", result.stderr)

    def test_the_tool_says_what_to_install(self):
        result = run([sys.executable, CLIENT, MATCH_V1], env=self.env)
        self.assertNamesWhatToInstall(result)
        self.assertTrue(result.stderr.startswith("tenon_client: "), result.stderr)
        self.assertEqual(result.stdout, "")

    def test_the_plugin_program_says_what_to_install(self):
        result = run([sys.executable, PLUGIN], env=self.env)
        self.assertNamesWhatToInstall(result)
        self.assertTrue(result.stderr.startswith("upcase_plugin: "), result.stderr)

    def test_the_library_imports_and_raises_a_clear_import_error_on_use(self):
        program = (
            "import sys, tenon_client\n"
            "for use in (lambda: tenon_client.Client('x'), lambda: tenon_client.encode_body({}),\n"
            "            lambda: tenon_client.decode_typed(b'')):\n"
            "    try:\n"
            "        use()\n"
            "    except ImportError as error:\n"
            "        assert error.name == 'cbor2', error.name\n"
            "        print(error)\n"
            "    else:\n"
            "        sys.exit('no ImportError')\n")
        result = run([sys.executable, "-c", program],
                     env=environment(PYTHONPATH=self.shadow + os.pathsep + CLIENT_DIR))
        self.assertEqual(result.returncode, 0, result.stderr)
        lines = result.stdout.splitlines()
        self.assertEqual(len(lines), 3, result.stdout)
        for line in lines:
            self.assertIn("python3-cbor2", line)


class InstalledPackageTest(unittest.TestCase):
    """A wheel built from a copy of examples/python (building writes into
    the directory), installed into a private directory, run against tenond."""

    @classmethod
    def setUpClass(cls):
        cls.work = tempfile.mkdtemp(prefix="tenon-wheel-")
        source = os.path.join(cls.work, "source")
        shutil.copytree(CLIENT_DIR, source, ignore=shutil.ignore_patterns("__pycache__", "build", "*.egg-info"))
        cls.dist = os.path.join(cls.work, "dist")
        built = run([sys.executable, "-m", "pip", "wheel", "--no-deps", "--no-build-isolation", "--no-index",
                     "--quiet", "--wheel-dir", cls.dist, source], timeout=300)
        if built.returncode != 0:
            raise AssertionError(f"pip wheel failed ({sys.executable} needs pip, setuptools and wheel):\n"
                                 f"{built.stdout}{built.stderr}")
        (cls.wheel,) = [os.path.join(cls.dist, name) for name in os.listdir(cls.dist)]
        cls.target = os.path.join(cls.work, "installed")
        installed = run([sys.executable, "-m", "pip", "install", "--no-deps", "--no-index", "--quiet",
                         "--target", cls.target, cls.wheel], timeout=300)
        if installed.returncode != 0:
            raise AssertionError(f"pip install failed:\n{installed.stdout}{installed.stderr}")
        cls.daemon = Daemon("com.ostrel.tenon.python-package-test")

    @classmethod
    def tearDownClass(cls):
        cls.daemon.stop()
        shutil.rmtree(cls.work, ignore_errors=True)

    def test_wheel_holds_the_module_and_the_command(self):
        with zipfile.ZipFile(self.wheel) as wheel:
            names = wheel.namelist()
            self.assertIn("tenon_client.py", names)
            (entry_points,) = [n for n in names if n.endswith(".dist-info/entry_points.txt")]
            self.assertIn("tenon-client = tenon_client:main", wheel.read(entry_points).decode())

    def test_installed_command_talks_to_tenond(self):
        command = os.path.join(self.target, "bin", "tenon-client")
        env = environment(TENON_ROOT=self.daemon.root, PYTHONPATH=self.target)
        result = run([command, "--service", "com.ostrel.tenon.python-package-test", MATCH_V1], env=env)
        # The daemon's refusal of version 1 is the proof of a round trip.
        self.assertEqual(result.returncode, 1, result.stderr + self.daemon.output())
        self.assertIn('"errorcode": 7', result.stdout)
        self.assertIn("tenon_client: error 7: ", result.stderr)
        self.assertNotIn("Traceback", result.stderr)

    def test_installed_command_names_an_unreachable_daemon(self):
        command = os.path.join(self.target, "bin", "tenon-client")
        env = environment(TENON_ROOT=self.daemon.root, PYTHONPATH=self.target)
        result = run([command, "--service", "com.ostrel.tenon.nobody-listens", MATCH_V1], env=env)
        self.assertEqual(result.returncode, 1)
        self.assertIn("cannot reach tenond at com.ostrel.tenon.nobody-listens", result.stderr)


if __name__ == "__main__":
    unittest.main()
