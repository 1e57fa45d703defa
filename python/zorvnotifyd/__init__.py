"""Following the monitor queues of zorvnotifyd from Python.

A Subscription connects to the daemon's Unix socket, subscribes to queues by
name and yields their records as Event objects::

    import zorvnotifyd

    with zorvnotifyd.Subscription() as sub:
        sub.subscribe("backup")
        for event in sub.events():
            if event.kind == "event":
                print(event.seq, event.path, event.mask)

What a Subscription guarantees:

- It trusts only a socket whose peer runs as root (SO_PEERCRED, uid 0): any
  other peer raises NotRoot before anything it sent is read.
- When the daemon goes away it connects again, waiting 100 ms first and twice
  as long after each failed attempt, up to 5 s, and subscribes again with the
  last sequence number it delivered for each queue (a queue is a type, a file
  and a name), so that no record is skipped that the daemon still keeps.
- It delivers nothing twice: a record whose sequence number is not above the
  last one delivered for its queue is dropped.
- When the daemon's numbering is not the one it followed (the daemon's
  journal id differs, or, from a daemon without a journal, its run), it
  cannot resume: it yields a "rescan" event with the path "" (the queue's
  whole trees) for each queue it followed and goes on from the daemon's
  current numbering.  The daemon's own "rescan" records come as they are.
- Every line it reads is bounded: a line longer than 1 MiB ends the
  connection, which is then made again.
- The daemon's refusals and {"error": ...} replies raise Error; nothing is
  printed.

One Subscription is used by one thread at a time.
"""

import base64
import collections
import json
import select
import socket as _socket
import struct
import time
from dataclasses import dataclass
from typing import Iterator, Optional

__all__ = ["DEFAULT", "Error", "NotRoot", "Event", "Subscription"]

DEFAULT = "/run/zorvnotifyd/zorvnotifyd.sock"
"""The daemon's socket when it runs with its defaults."""

MAX_LINE = 1 << 20
"""The longest line read (bytes); a longer one ends the connection."""

REPLY_TIMEOUT = 10.0
"""Seconds to wait for a connection, a reply or room to send a request
before the connection counts as lost."""

_TYPES = ("share", "etc", "local-etc")
_FIRST_BACKOFF = 0.1
_LAST_BACKOFF = 5.0


class Error(Exception):
    """The daemon refused a request or the connection ({"error": ...})."""


class NotRoot(Error):
    """The socket's peer does not run as root: nothing it says is trusted."""


@dataclass(slots=True)
class Event:
    """One record of a followed queue.

    kind is "event", "lost", "removed", "registered", "missed" or "rescan";
    queue, type ("share", "etc" or "local-etc") and file name the queue.
    seq is the record's sequence number in its queue; None for "missed",
    which carries none.  path is the event's path ("event") or what to look at
    again ("rescan", "" meaning the queue's whole trees); bytes that are not
    UTF-8 come as lone surrogates, so path.encode("utf-8", "surrogateescape")
    gives the exact bytes.  mask holds the inotify IN_* bits of an "event";
    offline is True for a change made while the daemon was not watching;
    missed is how many records of the queue are gone ("missed").
    """

    kind: str
    queue: str
    type: str
    file: str
    seq: Optional[int] = None
    path: str = ""
    mask: int = 0
    offline: bool = False
    missed: int = 0


class _Lost(Exception):
    """The connection ended or can no longer be used; it will be made again."""


def _is_int(value) -> bool:
    return isinstance(value, int) and not isinstance(value, bool) and value >= 0


def _bytes_member(record: dict, key: str):
    """record[key], or the exact bytes of its "KEY_b64" form when the daemon
    sent one (a name that is not UTF-8), as str with surrogateescape.

    Raises _Lost when that form is not standard base64.
    """
    encoded = record.get(key + "_b64")
    if encoded is None:
        return record.get(key)
    try:
        if not isinstance(encoded, str):
            raise ValueError("not a string")
        return base64.b64decode(encoded, validate=True).decode("utf-8", "surrogateescape")
    except ValueError as e:  # binascii.Error is one
        raise _Lost("a record whose %s_b64 is not base64" % key) from e


def _event(record: dict) -> Optional[Event]:
    """The Event a record line holds; None for a kind this module does not know.

    Raises _Lost when the record is malformed.
    """
    queue, type_, file = (_bytes_member(record, "queue"), record.get("type"),
                          _bytes_member(record, "file"))
    seq = record.get("seq")
    if not all(isinstance(v, str) for v in (queue, type_, file)):
        raise _Lost("a record without its queue, type and file")
    if seq is not None and not _is_int(seq):
        raise _Lost("a record with a sequence number that is not one")
    if "missed" in record:
        if not _is_int(record["missed"]):
            raise _Lost("a missed notice without a count")
        return Event("missed", queue, type_, file, None, missed=record["missed"])
    if seq is None:
        return None
    if "path" in record:
        path, mask = _bytes_member(record, "path"), record.get("mask")
        if not isinstance(path, str) or not _is_int(mask):
            raise _Lost("an event without its path and mask")
        return Event("event", queue, type_, file, seq, path, mask, record.get("offline") is True)
    if "rescan" in record:
        rescan = _bytes_member(record, "rescan")
        if not isinstance(rescan, str):
            raise _Lost("a rescan record without its path")
        return Event("rescan", queue, type_, file, seq, rescan)
    for kind in ("lost", "removed", "registered"):
        if record.get(kind) is True:
            return Event(kind, queue, type_, file, seq)
    return None


class Subscription:
    """A connection to zorvnotifyd that follows queues across its restarts.

    socket is the daemon's socket path.  journal, when given, is the journal
    id that the "since" numbers passed to subscribe() belong to (stored with
    them from an earlier Subscription's .journal); when the daemon's differs,
    those numbers do not apply and subscribe() starts from now, after a
    "rescan" event for each queue it matches.
    """

    def __init__(self, socket: str = DEFAULT, journal: Optional[str] = None):
        self._path = socket
        # The numbering that the since values given to subscribe() belong
        # to: the journal given, else that of the first connection.
        self._since_numbering = ("journal", journal) if journal is not None else None
        self._sock: Optional[_socket.socket] = None
        self._buffer = bytearray()
        self._pending: collections.deque = collections.deque()
        # The user's subscriptions: [name, type, file, since], since set to
        # None once a reply has applied it.
        self._subs: list = []
        # The last sequence number taken for each queue, by (type, file, name).
        self._last: dict = {}
        # What the numbering belongs to: ("journal", id) or ("run", id).
        self._numbering: Optional[tuple] = None
        self._journal: Optional[str] = None
        self._backoff = _FIRST_BACKOFF
        self._next_try = 0.0
        self._closed = False

    @property
    def journal(self) -> Optional[str]:
        """The daemon's journal id (32 hex digits); None before the first
        connection or from a daemon that has none.  Store it with the last
        seq handled to resume later (see the journal argument)."""
        return self._journal

    def subscribe(self, name: str, since: Optional[int] = None, type: Optional[str] = None,
                  file: Optional[str] = None) -> None:
        """Follows every queue named name (of that type and queue file, when given).

        Without since, the records from now on; with since, every record
        after that sequence number that the daemon still keeps (a "missed"
        event says how many are gone), then the new ones.  since belongs to
        the journal given to Subscription() (without one, to the numbering
        of the first connection): under another, it cannot apply, and the
        queues are followed from now, after a "rescan" event each.

        Raises Error when the daemon refuses the subscription, NotRoot when
        the socket's peer is not root; when the daemon cannot be reached,
        the subscription is kept and made when events() gets through.
        """
        if not isinstance(name, str):
            raise TypeError("name must be a str")
        if type is not None and type not in _TYPES:
            raise ValueError('type must be "share", "etc" or "local-etc"')
        if file is not None and not isinstance(file, str):
            raise TypeError("file must be a str")
        if since is not None and not _is_int(since):
            raise ValueError("since must be a sequence number (an int, 0 or more)")
        self._check_open()
        sub = [name, type, file, since]
        if self._sock is None and time.monotonic() >= self._next_try:
            self._subs.append(sub)
            self._try_connect()  # sends every subscription, this one included
            return
        if self._sock is None:
            self._subs.append(sub)
            return
        try:
            self._send_sub(sub)
        except _Lost:
            self._subs.append(sub)
            self._drop()
            return
        self._subs.append(sub)

    def events(self, timeout: Optional[float] = None) -> Iterator[Event]:
        """Yields the records of the followed queues, in the order they came.

        timeout (seconds) bounds the wait for each event: the generator ends
        when none came in time (a connection being made may add up to
        REPLY_TIMEOUT); None waits for ever.  Reconnects as needed.
        Raises Error on a refusal and NotRoot when the peer is not root.
        """
        while not self._closed:
            if self._pending:
                yield self._pending.popleft()
                continue
            deadline = None if timeout is None else time.monotonic() + timeout
            while not self._pending and not self._closed:
                now = time.monotonic()
                if deadline is not None and now >= deadline:
                    return
                if self._sock is None:
                    if now < self._next_try:
                        wait = self._next_try - now
                        time.sleep(wait if deadline is None else min(wait, deadline - now))
                        continue
                    self._try_connect()
                    continue
                try:
                    # Lines that came with a reply are already in the buffer.
                    if b"\n" not in self._buffer:
                        wait = None if deadline is None else max(0.0, deadline - now)
                        if not self._wait_readable(wait):
                            continue
                        self._fill()
                    for message in self._lines():
                        self._take(message)
                except _Lost:
                    self._drop()

    def close(self) -> None:
        """Closes the connection; events() then ends.  Safe to call twice."""
        self._closed = True
        if self._sock is not None:
            self._sock.close()
            self._sock = None

    def __enter__(self) -> "Subscription":
        return self

    def __exit__(self, *exc) -> None:
        self.close()

    # --- the connection ---

    def _check_open(self) -> None:
        if self._closed:
            raise ValueError("the Subscription is closed")

    def _drop(self) -> None:
        """Ends the connection; the next attempt waits for the backoff."""
        if self._sock is not None:
            self._sock.close()
            self._sock = None
        self._buffer.clear()
        self._next_try = time.monotonic() + self._backoff
        self._backoff = min(self._backoff * 2, _LAST_BACKOFF)

    def _try_connect(self) -> None:
        """Connects, checks the peer, learns the numbering and subscribes again.

        Leaves the Subscription disconnected (with the next attempt set) when
        the daemon cannot be reached or the connection is lost meanwhile.
        """
        sock = _socket.socket(_socket.AF_UNIX, _socket.SOCK_STREAM | _socket.SOCK_CLOEXEC)
        # Bounds connect() (a full listen backlog blocks it) and sendall();
        # reads wait in poll() first.
        sock.settimeout(REPLY_TIMEOUT)
        try:
            sock.connect(self._path)
            creds = sock.getsockopt(_socket.SOL_SOCKET, _socket.SO_PEERCRED,
                                    struct.calcsize("3i"))
            pid, uid, _ = struct.unpack("3i", creds)
            if uid != 0:
                raise NotRoot(f"the socket {self._path!r} is served by uid {uid} (pid {pid}), "
                              "not by root: refused")
        except OSError:
            sock.close()
            self._drop()
            return
        except NotRoot:
            sock.close()
            self._drop()
            raise
        self._sock = sock
        try:
            self._resubscribe()
        except _Lost:
            self._drop()
            return
        except Error:
            self._drop()
            raise
        self._backoff = _FIRST_BACKOFF

    def _resubscribe(self) -> None:
        """On a new connection: the numbering first, then each queue followed
        from where it stopped (or from now, with a rescan, when the numbering
        changed), then the user's subscriptions for queues not seen yet."""
        status = self._request({"request": "status"})
        journal = status.get("journal")
        numbering = ("journal", journal) if isinstance(journal, str) else ("run", status.get("run"))
        reset = self._numbering is not None and numbering != self._numbering
        self._numbering = numbering
        if self._since_numbering is None:
            self._since_numbering = numbering
        self._journal = journal if isinstance(journal, str) else None
        for (type_, file, name), last in list(self._last.items()):
            request = {"request": "subscribe", "queue": name, "type": type_, "file": file}
            if not reset:
                request["since"] = last
            reply = self._request(request)
            if reset:
                seq = self._reply_seqs(reply).get((type_, file, name), 0)
                self._last[(type_, file, name)] = seq
                self._pending.append(Event("rescan", name, type_, file, seq, ""))
        for sub in self._subs:
            self._send_sub(sub)

    def _send_sub(self, sub: list) -> None:
        """Sends one of the user's subscriptions and takes its reply."""
        name, type_, file, since = sub
        stale = since is not None and self._since_numbering != self._numbering
        request = {"request": "subscribe", "queue": name}
        if type_ is not None:
            request["type"] = type_
        if file is not None:
            request["file"] = file
        if since is not None and not stale:
            request["since"] = since
        try:
            reply = self._request(request)
        except Error:
            self._subs = [s for s in self._subs if s is not sub]
            raise
        sub[3] = None
        for key, seq in self._reply_seqs(reply).items():
            if key in self._last:
                continue
            if stale:
                self._pending.append(Event("rescan", key[2], key[0], key[1], seq, ""))
            self._last[key] = since if since is not None and not stale else seq

    @staticmethod
    def _reply_seqs(reply: dict) -> dict:
        """The queues a subscribe reply lists: (type, file, name) -> last seq."""
        seqs = {}
        queues = reply.get("queues")
        name = reply.get("queue")
        if not isinstance(queues, list) or not isinstance(name, str):
            raise _Lost("a subscribe reply without its queues")
        for q in queues:
            if not (isinstance(q, dict) and isinstance(q.get("type"), str)
                    and isinstance(q.get("file"), str) and _is_int(q.get("seq"))):
                raise _Lost("a subscribe reply with a malformed queue")
            seqs[(q["type"], q["file"], name)] = q["seq"]
        return seqs

    def _request(self, request: dict) -> dict:
        """Sends request and returns its reply, taking the records that come
        before it.  Raises Error on an {"error": ...} line, _Lost when the
        connection ends or no reply comes within REPLY_TIMEOUT."""
        line = json.dumps(request, ensure_ascii=False).encode("utf-8", "surrogateescape")
        try:
            self._sock.sendall(line + b"\n")
        except OSError as e:
            raise _Lost(str(e)) from e
        deadline = time.monotonic() + REPLY_TIMEOUT
        while True:
            for message in self._lines():
                if "reply" in message:
                    return message
                if "error" in message:
                    raise Error(str(message["error"]))
                self._take(message)
            if not self._wait_readable(max(0.0, deadline - time.monotonic())):
                raise _Lost("no reply")
            self._fill()

    def _take(self, message: dict) -> None:
        """Queues the event a record line holds, unless its queue already had it."""
        if "error" in message:
            raise Error(str(message["error"]))
        if "reply" in message:
            return
        event = _event(message)
        if event is None:
            return
        key = (event.type, event.file, event.queue)
        if event.seq is not None:
            if event.seq <= self._last.get(key, 0):
                return
            self._last[key] = event.seq
        self._pending.append(event)

    def _wait_readable(self, timeout: Optional[float]) -> bool:
        """True when the socket is readable within timeout seconds (None: for ever)."""
        poller = select.poll()
        poller.register(self._sock, select.POLLIN)
        return bool(poller.poll(None if timeout is None else int(timeout * 1000) + 1))

    def _fill(self) -> None:
        """Reads once into the line buffer; raises _Lost at the end of the
        connection or when a line grows beyond MAX_LINE."""
        try:
            chunk = self._sock.recv(65536)
        except (BlockingIOError, InterruptedError):
            return
        except OSError as e:
            raise _Lost(str(e)) from e
        if not chunk:
            raise _Lost("the daemon closed the connection")
        self._buffer += chunk
        newline = self._buffer.rfind(b"\n")
        if len(self._buffer) - (newline + 1) > MAX_LINE:
            raise _Lost("a line longer than %d bytes" % MAX_LINE)

    def _lines(self) -> Iterator[dict]:
        """Takes the whole lines from the buffer, each a JSON object.
        Raises _Lost on a line that is not one."""
        while True:
            newline = self._buffer.find(b"\n")
            if newline < 0:
                return
            if newline > MAX_LINE:
                raise _Lost("a line longer than %d bytes" % MAX_LINE)
            line = bytes(self._buffer[:newline])
            del self._buffer[:newline + 1]
            try:
                message = json.loads(line.decode("utf-8", "surrogateescape"))
            except (ValueError, RecursionError) as e:
                raise _Lost("a line that is not JSON") from e
            if not isinstance(message, dict):
                raise _Lost("a line that is not a JSON object")
            yield message
