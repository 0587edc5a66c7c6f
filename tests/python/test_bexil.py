"""The Python module bexil against the real bxd on private directories: each request once through a plug-in's
life, then each way a request fails (bxd not running, bad JSON, an unknown plug-in, a missing entitlement, a
closed client) as bexil.Error with code and message.

Run by ctest with BEXIL_BINARY_DIR and BEXIL_SOURCE_DIR set, libbexil.so.0 on LD_LIBRARY_PATH and the module on
PYTHONPATH."""

import datetime
import json
import os
import queue
import shutil
import subprocess
import sys
import tempfile
import time
import unittest
import uuid

import bexil

BINARY_DIR = os.environ["BEXIL_BINARY_DIR"]
SOURCE_DIR = os.environ["BEXIL_SOURCE_DIR"]
MANAGER = "com.quorvel.private.bexil.manager"


class PrivateDaemon:
    """bxd on a temporary root (service, state, runtime and entitlements directories), with this process's BX_*
    variables pointing there so that the library finds it."""

    def __init__(self):
        self.root = os.path.realpath(tempfile.mkdtemp(prefix="bxd-python-"))
        for sub in ("service", "state", "runtime", "entitlements.d", "bundles"):
            os.makedirs(os.path.join(self.root, sub))
        os.chmod(os.path.join(self.root, "entitlements.d"), 0o755)
        self.environment = {
            "BX_SERVICE_DIR": os.path.join(self.root, "service"),
            "BX_STATE_DIR": os.path.join(self.root, "state"),
            "BX_RUNTIME_DIR": os.path.join(self.root, "runtime"),
            "BX_ENTITLEMENTS_DIR": os.path.join(self.root, "entitlements.d"),
            "BX_LOG_SINK": "stderr",
        }
        os.environ.update(self.environment)
        self.process = None
        self.log_path = os.path.join(self.root, "bxd.log")

    def start(self):
        with open(self.log_path, "ab") as log:
            self.process = subprocess.Popen(
                [os.path.join(BINARY_DIR, "src/daemon/bxd"), "-d", os.path.join(self.root, "annotations.vrec")],
                stdout=log, stderr=log)
        deadline = time.monotonic() + 10
        while time.monotonic() < deadline and self.process.poll() is None:
            if "listening on service" in self.log():
                return
            time.sleep(0.01)
        raise AssertionError("bxd did not come up:\n" + self.log())

    def log(self):
        with open(self.log_path, errors="replace") as log:
            return log.read()

    def grant_manager(self):
        """Gives this interpreter the manager entitlement; it counts for connections made afterwards."""
        with open(os.path.join(self.root, "entitlements.d", "python.vrec"), "w") as document:
            document.write('<?xml version="1.0" encoding="UTF-8"?>\n<vrec version="1">\n<dict>\n'
                           f"<key>Executable</key><string>{os.path.realpath(sys.executable)}</string>\n"
                           f"<key>Entitlements</key><dict><key>{MANAGER}</key><true/></dict>\n</dict>\n</vrec>\n")

    def stop(self):
        if self.process and self.process.poll() is None:
            self.process.terminate()
            self.process.wait(timeout=10)
        shutil.rmtree(self.root, ignore_errors=True)


def bubblewrap_works():
    return subprocess.run(["bwrap", "--unshare-all", "--ro-bind", "/", "/", "true"],
                          stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL).returncode == 0


class ClientTest(unittest.TestCase):
    def setUp(self):
        self.bxd = PrivateDaemon()
        self.addCleanup(self.bxd.stop)
        greeter = os.path.join(self.bxd.root, "bundles", "Greeter.app")
        shutil.copytree(os.path.join(SOURCE_DIR, "examples/bundles/Greeter.app"), greeter)
        self.hello = os.path.join(greeter, "PlugIns", "Hello.bxplugin")
        shutil.copyfile(os.path.join(BINARY_DIR, "examples/plugins/hello-plugin"), os.path.join(self.hello, "hello"))

    def test_every_request_once(self):
        """Guards each request with the Python types of its answer: add, bulk, match (an iterator of forms with a
        UUID and a datetime), ready, access, annotate and bulk_annotate (whose change an observer sees), hold (a
        UUID), holds, release_hold, status, launch (a pid and a socket the plug-in answers on) and remove."""
        self.bxd.start()
        self.bxd.grant_manager()
        with bexil.Client(timeout=20) as client:
            self.assertEqual(client.service, "com.quorvel.bexil.bxd")
            seen = queue.Queue()
            token = client.observe(bexil.ANNOTATION_CHANGE, lambda name, counter: seen.put((name, counter)))

            client.add([self.hello])
            client.bulk()
            forms = list(client.match({"RZExtensionIdentifier": "com.example.greeter.hello"}))
            self.assertEqual(len(forms), 1, forms)
            form = forms[0]
            self.assertEqual(form["path"], self.hello)
            self.assertIsInstance(form["uuid"], uuid.UUID)
            self.assertIsInstance(form["lastmodified"], datetime.datetime)
            plugin = form["uuid"]

            client.ready([plugin])
            self.assertEqual(len(client.access([plugin])), 1)
            client.annotate([plugin], {"election": 1})
            self.assertEqual(seen.get(timeout=10)[0], bexil.ANNOTATION_CHANGE)
            client.bulk_annotate({plugin: {"election": 0, "extension": {"note": b"\x00\x01"}}})
            seen.get(timeout=10)
            annotations = next(client.match({"RZExtensionIdentifier": "com.example.greeter.hello"}))["annotations"]
            self.assertIn('{"note": "AAE="}', json.dumps(annotations), "bytes travel as base64 text")
            client.stop_observing(token)

            hold = client.hold([self.hello], bexil.HOLD_PLUGIN_PATHS)
            self.assertIsInstance(hold, uuid.UUID)
            holds = client.holds()
            self.assertEqual([h["uuid"] for h in holds], [hold])
            self.assertIsInstance(holds[0]["created"], datetime.datetime)
            client.release_hold(hold)
            status = client.status()
            self.assertEqual(status["holdCount"], 0)
            self.assertEqual(status["served"]["lock"], 2)

            if bubblewrap_works():
                launched = client.launch(plugin)
                self.assertGreater(launched.pid, 0)
                with launched.channel as channel:
                    channel.settimeout(10)
                    channel.sendall(b"world\n")
                    self.assertTrue(channel.recv(64).startswith(b"Hello, world!"))

            client.remove([self.hello])
            self.assertEqual(list(client.match()), [])

    def test_each_error_path(self):
        """Guards the failures as bexil.Error with code and message: bxd not running (no_reply), JSON the library
        refuses, an unknown plug-in, a missing entitlement (with the daemon's reply), and a closed client."""
        with bexil.Client() as client:
            with self.assertRaises(bexil.Error) as down:
                client.status()
            self.assertEqual(down.exception.code, bexil.Code.INVALID_REQUEST)
            self.assertTrue(down.exception.no_reply)
            self.assertIn(os.path.join(self.bxd.root, "service", "com.quorvel.bexil.bxd"), down.exception.message)

        self.bxd.start()
        with bexil.Client() as client:
            cases = [
                (lambda: client.match({"RZExtensionIdentifier": float("nan")}), bexil.Code.INVALID_REQUEST,
                 "bexil_match: rules_json: JSON line 1, column "),
                (lambda: client.bulk_annotate({uuid.uuid4(): {"election": 1}}), bexil.Code.REGISTRY_REFUSED,
                 "no plug-in with the requested uuid"),
                (lambda: client.ready(["not-a-uuid"]), bexil.Code.INVALID_REQUEST,
                 "bexil_ready: an entry of uuids: not a UUID: not-a-uuid"),
                (client.holds, bexil.Code.NOT_ALLOWED, "caller lacks entitlement for this operation"),
            ]
            for call, code, message in cases:
                with self.subTest(message=message):
                    with self.assertRaises(bexil.Error) as caught:
                        call()
                    self.assertEqual(caught.exception.code, code)
                    self.assertTrue(caught.exception.message.startswith(message), caught.exception.message)
                    self.assertFalse(caught.exception.no_reply)
            self.assertEqual(caught.exception.reply["errorcode"], bexil.Code.NOT_ALLOWED)
        with self.assertRaises(bexil.Error) as closed:
            client.status()
        self.assertEqual(closed.exception.message, "the client is closed")


if __name__ == "__main__":
    unittest.main()
