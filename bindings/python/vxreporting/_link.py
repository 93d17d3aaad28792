"""The connection as both clients use it: never waits, has no threads. Who uses it waits for its descriptor, or for as long as
retry_in() says, and calls step()."""
import collections
import dataclasses
import errno
import os
import socket
import struct
import time
from collections.abc import Callable
from typing import Any

from . import _cbor
from ._errors import (BufferFull, ConnectionLost, EncodingError, Error, MessageRefused, NotConnected, ProtocolError,
                      ServiceError)
from ._vocabulary import Operation, Reporter

DEFAULT_SOCKET = "/run/vxreporting/service.socket"
HELLO, CALL, REPLY, ERROR, GOODBYE = range(5)
_LENGTH = struct.Struct("<I")
_READ_BYTES = 64 << 10
_LARGEST_ANNOUNCED = 64 << 20
_FIRST_RETRY, _LAST_RETRY = 0.05, 5.0  # seconds, doubling from one to the other


@dataclasses.dataclass
class Counters:
    """What became of calls besides being answered, and of the connection."""
    reconnections: int = 0
    unanswered: int = 0  # written when the connection was lost: may have run, not made again
    dropped: int = 0  # refused for lack of buffer, or never written
    sessions_not_restored: int = 0
    unknown_answers: int = 0


class Call:
    """One call. Done when it has a value or an error; on_done is called then, once."""

    def __init__(self, number: int, operation: Operation, arguments: tuple[Any, ...], restores: bool = False) -> None:
        self.number = number
        self.operation = operation
        self.arguments = arguments
        self.restores = restores
        self.done = False
        self.value: Any = None
        self.error: Error | None = None
        self.on_done: Callable[[Call], None] | None = None

    def frame(self) -> bytes:
        return _cbor.frame(CALL, self.number, int(self.operation), *self.arguments)

    def finish(self, value: Any, error: Error | None = None) -> None:
        self.done, self.value, self.error = True, value, error
        if self.on_done is not None:
            self.on_done(self)

    def result(self) -> Any:
        if self.error is not None:
            raise self.error.with_traceback(None)
        return self.value


def _understood(operation: Operation, value: Any) -> Any:
    """The value as the caller gets it; an Error when it is not of the kind it must be."""
    def is_integer(v: Any) -> bool:
        return isinstance(v, int) and not isinstance(v, bool)

    if operation is Operation.SEND:
        if value is None:
            return None
        if isinstance(value, dict) and isinstance(value.get("domain"), str) and is_integer(value.get("code")):
            return MessageRefused(value["domain"], value["code"])
    elif operation is Operation.GET_TYPE:
        if is_integer(value) and 0 <= value <= 65535:
            return value
    elif operation is Operation.VALIDATE:
        if isinstance(value, dict) and is_integer(value.get("reporterID")) and is_integer(value.get("serviceType")):
            return Reporter(value["reporterID"], value["serviceType"])
    elif operation is Operation.REPORTERS:
        if isinstance(value, list) and all(map(is_integer, value)):
            return value
    elif isinstance(value, bool):
        return value
    return ServiceError(0, f"the service answered {operation.name} with a value of another kind")


class _KeptSession:
    def __init__(self, created: int) -> None:
        self.created = created  # the number of the call that did
        self.set_up: dict[Operation, tuple[Any, ...]] = {}
        self.start: Call | None = None


class Link:
    """One connection after the other to one socket. Bounds: max_buffered_bytes, max_pending_calls, and what is read: one frame.

    With keep_sessions a connection that is lost is made again: sessions are created, set up and started as they were, and
    calls that were not begun to be written follow. Those that were written and not answered fail: they may have run.
    """

    def __init__(self, path: str | None, keep_sessions: bool, max_buffered_bytes: int, max_pending_calls: int) -> None:
        self.path = path or os.environ.get("VXREPORTING_SOCKET") or DEFAULT_SOCKET
        self.keep_sessions = keep_sessions
        self.counters = Counters()
        self.ended: Error | None = None  # why the last connection did, or could not be made
        self.greeted = False
        self._max_buffered = max_buffered_bytes
        self._max_pending = max_pending_calls
        self._process = os.getpid()
        self._socket: socket.socket | None = None
        self._open = False  # calls are taken
        self._goodbye_said = False
        self._ever_greeted = False
        self._leaving = False  # the service is: nothing more is written to it
        self._number = 0
        self._largest = 1 << 20
        self._head = b""  # bytes that go out before any call's
        self._out: collections.deque[tuple[bytes, Call | None]] = collections.deque()
        self._out_bytes = 0
        self._begun = 0  # bytes of the first of them that are written
        self._pending: dict[int, Call] = {}
        self._in = bytearray()
        self._kept: dict[int, _KeptSession] = {}
        self._delay = 0.0
        self._retry_at = 0.0

    # --- for whoever waits ---

    def fileno(self) -> int:
        return self._socket.fileno() if self._socket is not None else -1

    def wants_write(self) -> bool:
        return self._socket is not None and bool(self._head or (self.greeted and self._out and not self._leaving))

    def retry_in(self) -> float | None:
        """Seconds until step() should be called though no descriptor is ready."""
        if self._socket is not None or not (self._open and self.keep_sessions):
            return None
        return max(0.0, self._retry_at - time.monotonic())

    def unanswered(self) -> int:
        """Calls, started sessions apart."""
        return sum(call.operation is not Operation.START for call in self._pending.values())

    def step(self) -> None:
        """Connects when that is due, reads and writes as much as there is: first what a service that leaves has said."""
        self._check_process()
        if self._socket is None and self.retry_in() == 0.0:
            self._connect()
        self._read()
        self._write()

    # --- connecting and ending ---

    def open(self) -> None:
        """Takes calls from now on, and tries to connect once."""
        self._check_process()
        if self._socket is None:
            self._open, self._goodbye_said = True, False
            self._connect()
            if self._socket is None and not self.keep_sessions:
                self._open = False

    def say_goodbye(self) -> None:
        self._open = False
        self._goodbye_said = True
        self._out.append((_cbor.frame(GOODBYE), None))
        self._write()

    def close(self, why: Error | None = None) -> None:
        self._open = False
        self._kept.clear()
        self._lost(why or ConnectionLost("the connection was closed by the caller"))

    def let_go(self) -> None:
        """Closes the descriptor and nothing else."""
        if self._socket is not None:
            self._socket.close()
            self._socket = None

    def _check_process(self) -> None:
        if os.getpid() != self._process:
            raise NotConnected("the connection belongs to the process that was forked; make a client of your own")

    def _connect(self) -> None:
        made = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)  # close-on-exec
        made.setblocking(False)
        try:
            made.connect(self.path)
        except OSError as e:
            made.close()
            why = "it takes no connections" if e.errno == errno.EAGAIN else e.strerror or str(e)
            self._failed(NotConnected(f"cannot connect to {self.path}: {why} (is vxreportingd running? set "
                                      "VXREPORTING_SOCKET to its socket)"))
            return
        self._socket, self.greeted, self._leaving = made, False, False
        self._in.clear()
        self._largest = 1 << 20
        self._head = _cbor.frame(HELLO, 1)

    def _failed(self, why: Error) -> None:
        self.ended = why
        self._retry_at = time.monotonic() + self._delay
        self._delay = min(_LAST_RETRY, max(_FIRST_RETRY, 2 * self._delay))

    def _lost(self, why: Error) -> None:
        self.let_go()
        self.greeted = False
        self._failed(why)
        if self._begun:  # begun is as good as written
            self._pop()
        self._begun = 0
        unwritten = {c.number for _, c in self._out if c is not None}
        starts = {s.start for s in self._kept.values() if s.start is not None}
        if self._open and self.keep_sessions:
            self._out = collections.deque((f, c) for f, c in self._out if c is not None and not (c.restores or c in starts))
        else:
            self._out.clear()
            starts.clear()
        self._out_bytes = sum(len(f) for f, _ in self._out)
        survivors = starts | {c for _, c in self._out if c is not None}
        failed = [c for c in self._pending.values() if c not in survivors and not c.restores]
        self._pending = {c.number: c for c in sorted(survivors, key=lambda c: c.number)}
        for call in failed:
            if call.number in unwritten:
                self.counters.dropped += 1
            else:
                self.counters.unanswered += call.operation is not Operation.START
            call.finish(None, type(why)(str(why)) if isinstance(why, ConnectionLost) else why)

    # --- calls ---

    def call(self, operation: Operation, *arguments: Any) -> Call:
        self._check_process()
        if not self._open:
            raise NotConnected("goodbye has been said" if self._goodbye_said else
                               f"not connected to the service ({self.ended or 'connect() first'})")
        call = Call(self._number + 1, operation, arguments)
        frame = call.frame()
        if len(frame) - _LENGTH.size > self._largest:
            raise EncodingError(f"a call of {len(frame)} bytes; the service takes {self._largest}")
        if len(self._pending) >= self._max_pending or self._out_bytes + len(frame) > self._max_buffered:
            self._write()
        if len(self._pending) >= self._max_pending or self._out_bytes + len(frame) > self._max_buffered:
            self.counters.dropped += 1
            raise BufferFull(f"{len(self._pending)} calls wait for their answers, {self._out_bytes} bytes to be written")
        self._number += 1
        self._push(frame, call)
        return call

    def _push(self, frame: bytes, call: Call) -> None:
        self._out.append((frame, call))
        self._out_bytes += len(frame)
        self._pending[call.number] = call

    def _pop(self) -> None:
        frame, call = self._out.popleft()
        self._out_bytes -= len(frame) if call is not None else 0
        if call is not None and self.keep_sessions and not call.restores:
            self._note_written(call)

    # --- what is kept ---

    def _note_written(self, call: Call) -> None:
        operation, arguments = call.operation, call.arguments
        if operation is Operation.CREATE:
            self._kept.pop(arguments[0], None)
            self._kept[arguments[0]] = _KeptSession(call.number)
        elif operation is Operation.DESTROY:
            self._kept.pop(arguments[0], None)
        elif operation in (Operation.SET_TYPE, Operation.CONFIGURE, Operation.START, Operation.STOP):
            session = self._kept.get(arguments[-1])
            if session is None:
                return
            if operation is Operation.STOP:
                session.start = None
            elif operation is not Operation.START:
                session.set_up[operation] = arguments
            elif session.start is None and not call.done:
                session.start = call

    def _note_answered(self, call: Call) -> None:
        """A start that is answered holds no more; a session whose creation was refused is none."""
        if call.operation is Operation.START:
            for session in self._kept.values():
                if session.start is call:
                    session.start = None
        elif call.operation is Operation.CREATE and call.error is not None:
            self._kept = {i: s for i, s in self._kept.items() if s.created != call.number}

    def _restore(self) -> None:
        waiting, self._out = self._out, collections.deque()
        for identifier, session in self._kept.items():
            for operation, arguments in ((Operation.CREATE, (identifier,)), *session.set_up.items()):
                call = Call(self._number + 1, operation, arguments, restores=True)
                call.on_done = self._restored
                frame = call.frame()
                if len(frame) - _LENGTH.size > self._largest:  # the connection would end over it, and the next one again
                    self.counters.sessions_not_restored += 1
                    continue
                self._number += 1
                self._push(frame, call)
            if session.start is not None:  # the same call: it is answered when the session stops
                self._push(session.start.frame(), session.start)
        self._out.extend(waiting)

    def _restored(self, call: Call) -> None:
        if call.error is not None and call.operation is Operation.CREATE:
            self.counters.sessions_not_restored += 1

    # --- bytes ---

    def _write(self) -> None:
        while self.wants_write() and self._socket is not None:
            if self._head:
                data = self._head
            else:
                parts, size = [], 0
                for frame, _ in self._out:
                    parts.append(frame)
                    size += len(frame)
                    if size >= _READ_BYTES:
                        break
                data = b"".join(parts)[self._begun:]
            try:
                sent = self._socket.send(data)
            except (BlockingIOError, InterruptedError):
                return
            except OSError as e:
                self._last_words(e)
                return
            if self._head:
                self._head = self._head[sent:]
            else:
                self._wrote(sent)

    def _wrote(self, sent: int) -> None:
        self._begun += sent
        while self._out and self._begun >= len(self._out[0][0]):
            self._begun -= len(self._out[0][0])
            self._pop()

    def _last_words(self, error: OSError) -> None:
        """The service takes no more, but what it said before it left is still to be read."""
        self._read()
        if self._socket is not None:
            self._lost(ConnectionLost(f"the service went away: {error.strerror}"))

    def _read(self) -> None:
        """At most as much at a time as a service that never pauses cannot hold up the caller with."""
        for _ in range(16):
            if self._socket is None:
                return
            try:
                data = self._socket.recv(_READ_BYTES)
            except (BlockingIOError, InterruptedError):
                return
            except OSError as e:
                self._lost(ConnectionLost(f"the service went away: {e.strerror}"))
                return
            if not data:
                self._lost(ConnectionLost("the service ended" if self._leaving else "the service closed the connection"))
                return
            self._in += data
            try:
                self._frames()
            except Error as e:
                self._lost(e)

    def _frames(self) -> None:
        while self._socket is not None and len(self._in) >= _LENGTH.size:
            length, = _LENGTH.unpack_from(self._in)
            if length > self._largest:
                raise ProtocolError(f"the service sent a frame of {length} bytes")
            if len(self._in) < _LENGTH.size + length:
                return
            body = bytes(self._in[_LENGTH.size:_LENGTH.size + length])
            del self._in[:_LENGTH.size + length]
            self._frame(_cbor.elements(body))

    def _frame(self, frame: list[Any]) -> None:
        def is_integer(i: int) -> bool:
            return type(frame[i]) is int

        kind = frame[0] if frame and is_integer(0) else None
        if kind == GOODBYE:
            self._leaving = True
        elif kind == HELLO and not self.greeted and len(frame) > 1 and is_integer(1) and frame[1] == 1:
            self._hello(frame[2] if len(frame) > 2 and isinstance(frame[2], dict) else {})
        elif kind == REPLY and self.greeted and len(frame) > 2 and is_integer(1):
            self._answer(frame[1], frame[2], None)
        elif kind == ERROR and len(frame) > 3 and is_integer(2) and isinstance(frame[3], str):
            if frame[1] is None:
                raise ConnectionLost(f"the service closed the connection: {frame[3]} (error {frame[2]})")
            if not is_integer(1):
                raise ProtocolError("the service sent an error of no call")
            self._answer(frame[1], None, ServiceError(frame[2], frame[3]))
        else:
            raise ProtocolError("the service sent something that is not the protocol")

    def _hello(self, limits: dict[str, Any]) -> None:
        largest = limits.get("max_frame_bytes")
        if isinstance(largest, int) and largest > 0:
            self._largest = min(largest, _LARGEST_ANNOUNCED)
        if self._ever_greeted:
            self.counters.reconnections += 1
        self.greeted = self._ever_greeted = True
        self._restore()

    def _answer(self, number: int, value: Any, error: Error | None) -> None:
        call = self._pending.pop(number, None)
        if call is None:
            self.counters.unknown_answers += 1
            return
        self._delay = 0.0  # the service works
        if error is None:
            value = _understood(call.operation, value)
            if isinstance(value, Error):
                value, error = None, value
        call.error = error
        self._note_answered(call)
        call.finish(value, error)
