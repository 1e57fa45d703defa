"""Tests of the zorvnotifyd module and examples/python/follow.py.

Run by daemon_test inside its sandbox (as root, with a private /usr and
/tmp): ZORVNOTIFYD_PATH and ZORVNOTIFYCTL_PATH name the daemon and the tool,
ZORVNOTIFYD_SOCKET the socket in a directory of root's, and PYTHONPATH holds
the module.  The daemon is started and stopped here, as a restart is part of
what is checked.
"""

import json
import os
import signal
import socket
import subprocess
import sys
import threading
import time
import unittest

import zorvnotifyd

DAEMON = os.environ.get("ZORVNOTIFYD_PATH", "")
TOOL = os.environ.get("ZORVNOTIFYCTL_PATH", "")
SOCKET = os.environ.get("ZORVNOTIFYD_SOCKET", "/tmp/zorvrun/zorvnotifyd.sock")
FOLLOW = os.path.join(os.path.dirname(__file__), "..", "..", "examples", "python", "follow.py")
IN_CREATE = 0x100


def register(name, tree):
    """Registers the queue NAME watching TREE for IN_CREATE in queue file "py"."""
    os.makedirs(tree, exist_ok=True)
    queue = {"queue": name, "config": [{"path": tree, "mask": IN_CREATE}]}
    subprocess.run([TOOL, "upsert", "py"], input=json.dumps(queue).encode(), check=True,
                   stdout=subprocess.DEVNULL)


def touch(path):
    with open(path, "wb"):
        pass


class Daemon:
    """The daemon on SOCKET, ready once constructed; its log in /tmp."""

    def __init__(self, *args):
        self.log = "/tmp/py-daemon.log"
        with open(self.log, "wb") as log:
            self.process = subprocess.Popen([DAEMON, "--socket", SOCKET, *args],
                                            stdout=subprocess.DEVNULL, stderr=log)
        for _ in range(1000):
            with open(self.log, "rb") as log:
                if b"ready:" in log.read():
                    return
            if self.process.poll() is not None:
                break
            time.sleep(0.01)
        self.stop()
        raise AssertionError("the daemon did not get ready")

    def stop(self):
        self.process.send_signal(signal.SIGTERM)
        self.process.wait(10)


def take(subscription, count=None, until=None):
    """The next COUNT events, or those up to the one of path UNTIL, each as
    (kind, seq, path); fewer when none came for 10 s."""
    got = []
    for event in subscription.events(timeout=10):
        got.append((event.kind, event.seq, event.path))
        if len(got) == count or event.path == until:
            break
    return got


def serve(path, scripts, requests):
    """Serves one connection at PATH with each of SCRIPTS in turn, in a thread.

    A script (journal, answers, then, hold) answers each request line, kept
    in REQUESTS, with the next of ANSWERS under JOURNAL, then writes THEN
    (records, or bytes as they are) and, with HOLD, waits for the client to
    hang up.  The thread's failures are kept in the returned list.
    """
    listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    listener.bind(path)
    listener.listen()
    failures = []

    def exchange(reader, writer, journal, answers, then, hold):
        for answer in answers:
            requests.append(json.loads(reader.readline()))
            writer.write(json.dumps(dict(answer, journal=journal)).encode() + b"\n")
            writer.flush()
        for line in then:
            writer.write(line if isinstance(line, bytes) else json.dumps(line).encode() + b"\n")
        writer.flush()
        if hold:
            reader.read()

    def run():
        with listener:
            for script in scripts:
                conn, _ = listener.accept()
                with conn, conn.makefile("rb") as reader, conn.makefile("wb") as writer:
                    try:
                        exchange(reader, writer, *script)
                    except Exception as e:  # reported by the test
                        failures.append(repr(e))

    thread = threading.Thread(target=run, daemon=True)
    thread.start()
    return thread, failures


# Each daemon's first start over a tree records a rescan of it (seq 1), so a
# queue's events are numbered from 2 here.
class SubscriptionTest(unittest.TestCase):
    def test_follows_in_order_with_the_bytes_across_restarts_each_record_once(self):
        # A queue name and a path that are not UTF-8, on the way in and out.
        name, tree, other = "caf\udce9", "/tmp/py/order", "/tmp/py/restart"
        register(name, tree)
        register("r", other)
        daemon = Daemon("--state-dir", "/tmp/py/state")
        try:
            with zorvnotifyd.Subscription(SOCKET) as subscription:
                subscription.subscribe(name)
                for base in (b"a", b"b", b"caf\xe9"):
                    touch(tree.encode() + b"/" + base)
                got = take(subscription, 3)
                self.assertEqual(got, [("event", 2, tree + "/a"), ("event", 3, tree + "/b"),
                                       ("event", 4, tree + "/caf\udce9")])
                self.assertEqual(got[2][2].encode("utf-8", "surrogateescape"),
                                 b"/tmp/py/order/caf\xe9")
            # The example prints the records still kept, escaped.
            with subprocess.Popen([sys.executable, FOLLOW, "--socket", SOCKET, "--since", "2",
                                   name], stdout=subprocess.PIPE) as follow:
                lines = [follow.stdout.readline() for _ in range(2)]
                follow.terminate()
            self.assertEqual(lines, [b"etc/py 3 event /tmp/py/order/b 256\n",
                                     b"etc/py 4 event /tmp/py/order/caf\\udce9 256\n"])

            with zorvnotifyd.Subscription(SOCKET) as subscription:
                subscription.subscribe("r")
                touch(other + "/1")
                self.assertEqual(take(subscription, 1), [("event", 2, other + "/1")])
                journal = subscription.journal
                self.assertRegex(journal, "^[0-9a-f]{32}$")
                # Made while the daemon is away and just after it is back,
                # before the subscription is: resumed, once each, no gap.
                daemon.stop()
                touch(other + "/2")
                daemon = Daemon("--state-dir", "/tmp/py/state")
                touch(other + "/3")
                got = take(subscription, until=other + "/3")
                self.assertEqual(got[-1:], [("event", 2 + len(got), other + "/3")])
                self.assertEqual([seq for _, seq, _ in got], list(range(3, 3 + len(got))))
                self.assertEqual(subscription.journal, journal)
                # Another journal: no resuming, a rescan of the whole queue,
                # then the new numbering.
                daemon.stop()
                daemon = Daemon("--state-dir", "/tmp/py/other-state")
                # (numbered as the daemon's last record, its own first-start rescan)
                self.assertEqual(take(subscription, 1), [("rescan", 1, "")])
                touch(other + "/4")
                self.assertEqual(take(subscription, 1), [("event", 2, other + "/4")])
                self.assertNotEqual(subscription.journal, journal)
        finally:
            daemon.stop()

    def test_resumes_each_record_once_and_only_in_its_journal(self):
        # A daemon of the test's own (root, as the test runs): it repeats
        # records, sends a line of more than 1 MiB, and later a new journal;
        # then a number stored under a journal it no longer has.
        path = "/tmp/py-fake.sock"
        requests = []
        reply = {"reply": "subscribe", "queue": "f",
                 "queues": [{"type": "etc", "file": "x", "seq": 0}]}

        def record(seq):
            return {"queue": "f", "type": "etc", "file": "x", "seq": seq, "path": "/p%d" % seq,
                    "mask": 256}

        status = {"reply": "status", "run": "r"}
        overlong = b"x" * (1 << 20) + b"x"
        reply7 = dict(reply, queues=[{"type": "etc", "file": "x", "seq": 7}])
        thread, failures = serve(path, [
            ("J", [status, reply], [record(1), record(2), record(1), overlong], True),
            ("J", [status, reply, reply], [record(2), dict(record(3), path_b64="L3Az6Q==")], False),
            ("K", [status, reply7, reply], [record(7), record(8)], True),
            ("K", [status, reply], [record(1)], True),
        ], requests)
        with zorvnotifyd.Subscription(path) as subscription:
            subscription.subscribe("f")
            got = take(subscription, 5)
            self.assertEqual(subscription.journal, "K")
        with zorvnotifyd.Subscription(path, journal="J") as subscription:
            subscription.subscribe("f", since=5)
            got += take(subscription, 2)
        thread.join(10)
        os.unlink(path)
        self.assertEqual(failures, [])
        # A path's base64 bytes win over its text.
        self.assertEqual(got, [("event", 1, "/p1"), ("event", 2, "/p2"), ("event", 3, "/p3\udce9"),
                               ("rescan", 7, ""), ("event", 8, "/p8"),
                               ("rescan", 0, ""), ("event", 1, "/p1")])
        subscribe = {"request": "subscribe", "queue": "f"}
        resume = dict(subscribe, type="etc", file="x")
        self.assertEqual(requests, [{"request": "status"}, subscribe,
                                    {"request": "status"}, dict(resume, since=2), subscribe,
                                    {"request": "status"}, resume, subscribe,
                                    {"request": "status"}, subscribe])

    def test_refuses_a_peer_that_is_not_root(self):
        # Bound by root, listened on by uid 65534, which would say anything.
        path = "/tmp/py-theirs.sock"
        listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        listener.bind(path)
        ready_r, ready_w = os.pipe()
        pid = os.fork()
        if pid == 0:
            try:
                os.setgid(65534)
                os.setuid(65534)
                listener.listen()
                os.write(ready_w, b"!")
                conn, _ = listener.accept()
                conn.sendall(b'{"reply":"status","run":"x","journal":"x"}\n')
                conn.recv(1)
            finally:
                os._exit(0)
        listener.close()
        os.close(ready_w)
        self.assertEqual(os.read(ready_r, 1), b"!")
        os.close(ready_r)
        try:
            with zorvnotifyd.Subscription(path) as subscription:
                with self.assertRaisesRegex(zorvnotifyd.NotRoot, "uid 65534"):
                    subscription.subscribe("q")
        finally:
            os.kill(pid, signal.SIGKILL)
            os.waitpid(pid, 0)


if __name__ == "__main__":
    unittest.main(verbosity=2)
