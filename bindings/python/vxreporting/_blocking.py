"""The blocking client."""
import contextlib
import select
import time
from collections.abc import Callable, Iterable, Mapping
from types import TracebackType
from typing import Any, Self

from . import _vocabulary as vocabulary
from ._errors import Error, TimedOut
from ._link import Call, Counters, Link
from ._vocabulary import Operation, Reporter


class Client:
    """One client of the service. Not for several threads at once.

    socket_path: None stands for $VXREPORTING_SOCKET, or /run/vxreporting/service.socket. timeout: seconds that any method
    waits at most. keep_sessions: when the service restarts, sessions are created, set up and started again by the next
    method that is called, and what was buffered meanwhile is sent; connect() then does not need the service to be there.
    """

    def __init__(self, socket_path: str | None = None, *, timeout: float = 5.0, keep_sessions: bool = False,
                 max_buffered_bytes: int = 1 << 20, max_pending_calls: int = 65536) -> None:
        self.timeout = timeout
        self._link = Link(socket_path, keep_sessions, max_buffered_bytes, max_pending_calls)
        self._failed: Error | None = None  # the first of the calls that nobody waited for

    def connect(self) -> Self:
        """Waits for the service's hello."""
        self._link.open()
        try:
            if self._link.fileno() >= 0 or not self._link.keep_sessions:
                self._work(lambda: self._link.greeted)
        except Error:
            if not self._link.keep_sessions:
                self._link.close()
                raise
        return self

    def close(self) -> None:
        """Sends what waits, says goodbye and waits for the service to close. Safe to call twice."""
        if self._link.fileno() >= 0:
            try:
                self._work(lambda: self._link.greeted or self._link.fileno() < 0)
                self._link.say_goodbye()
                self._work(lambda: self._link.fileno() < 0)
            finally:
                self._link.close()
        self._link.close()

    def __enter__(self) -> Self:
        return self.connect()

    def __exit__(self, kind: type[BaseException] | None, error: BaseException | None, trace: TracebackType | None) -> None:
        if kind is None:
            try:
                self.flush()
            finally:
                self.close()
        else:
            with contextlib.suppress(Error):
                self.close()

    def __del__(self) -> None:
        if hasattr(self, "_link"):
            self._link.let_go()

    @property
    def connected(self) -> bool:
        return self._link.greeted

    @property
    def counters(self) -> Counters:
        return self._link.counters

    def fileno(self) -> int:
        """For a poll loop of the caller's own; -1 without a connection."""
        return self._link.fileno()

    def poll(self) -> None:
        """Connects when that is due, writes and reads what there is. Never waits."""
        self._link.step()

    def flush(self) -> None:
        """Waits until every call is answered, started sessions apart, and raises the first failure of those that nobody
        waited for."""
        if self._link.unanswered():
            self._work(lambda: self._link.unanswered() == 0)
        failed, self._failed = self._failed, None
        if failed is not None:
            raise failed.with_traceback(None)

    def session(self, identifier: int, *, service_type: int | str = 0,
                configuration: Mapping[str, Any] | None = None) -> "Session":
        """A session for a with statement: created, set up and started there, stopped and destroyed at its end."""
        return Session(self, identifier, service_type, configuration)

    def create_session(self, identifier: int) -> bool:
        return bool(self._call(Operation.CREATE, vocabulary.identifier_of(identifier)))

    def set_service_type(self, identifier: int, service_type: int | str) -> bool:
        return bool(self._call(Operation.SET_TYPE, vocabulary.service_type_of(service_type),
                               vocabulary.identifier_of(identifier)))

    def service_type(self, identifier: int) -> int:
        """65535 when there is no such session."""
        return int(self._call(Operation.GET_TYPE, vocabulary.identifier_of(identifier)))

    def configure(self, identifier: int, configuration: Mapping[str, Any]) -> bool:
        return bool(self._call(Operation.CONFIGURE, vocabulary.dictionary_of("a configuration", configuration),
                               vocabulary.identifier_of(identifier)))

    def start_session(self, identifier: int) -> Call:
        """Does not wait: a start is answered when the session is stopped. The call's `done` says whether it is."""
        call = self._link.call(Operation.START, vocabulary.identifier_of(identifier))
        self._link.step()
        return call

    def send_message(self, message: Mapping[str, Any], *, category: int | str, type: int | str,
                     sessions: Iterable[int] | None = None, wait: bool = True) -> None:
        """To these sessions, or to all that are started. Without waiting, a failure is raised by the next flush()."""
        arguments = (vocabulary.dictionary_of("a message", message), vocabulary.category_of(category),
                     vocabulary.message_type_of(type), vocabulary.identifiers_of(sessions))
        if wait:
            self._call(Operation.SEND, *arguments)
        else:
            self._link.call(Operation.SEND, *arguments).on_done = self._note_failure
            self._link.step()

    def stop_session(self, identifier: int) -> bool:
        return bool(self._call(Operation.STOP, vocabulary.identifier_of(identifier)))

    def destroy_session(self, identifier: int) -> bool:
        return bool(self._call(Operation.DESTROY, vocabulary.identifier_of(identifier)))

    def validate(self, identifier: int) -> Reporter:
        reporter = self._call(Operation.VALIDATE, vocabulary.identifier_of(identifier))
        assert isinstance(reporter, Reporter)
        return reporter

    def reporters(self) -> list[int]:
        """The identifiers of all clients' sessions."""
        return list(self._call(Operation.REPORTERS))

    def _note_failure(self, call: Call) -> None:
        self._failed = self._failed or call.error

    def _call(self, operation: Operation, *arguments: Any) -> Any:
        call = self._link.call(operation, *arguments)
        self._work(lambda: call.done)
        return call.result()

    def _work(self, finished: Callable[[], bool]) -> None:
        link, end = self._link, time.monotonic() + self.timeout
        while True:
            link.step()
            if finished():
                return
            retry = link.retry_in()
            if link.fileno() < 0 and retry is None:
                raise (link.ended or Error("not connected")).with_traceback(None)
            left = end - time.monotonic()
            if left <= 0:
                raise TimedOut(f"no answer from the service in {self.timeout} s" +
                               (f" ({link.ended})" if retry is not None else ""))
            poller = select.poll()
            if link.fileno() >= 0:
                poller.register(link.fileno(), select.POLLIN | (select.POLLOUT if link.wants_write() else 0))
            poller.poll(1000 * min(left, left if retry is None else retry) + 1)


class Session:
    """A session of Client.session()."""

    def __init__(self, client: Client, identifier: int, service_type: int | str,
                 configuration: Mapping[str, Any] | None) -> None:
        self.identifier = vocabulary.identifier_of(identifier)
        self._client = client
        self._service_type = vocabulary.service_type_of(service_type)
        self._configuration = configuration

    def __enter__(self) -> Self:
        self._client.create_session(self.identifier)
        self._client.set_service_type(self.identifier, self._service_type)
        if self._configuration is not None:
            self._client.configure(self.identifier, self._configuration)
        self._client.start_session(self.identifier)
        return self

    def __exit__(self, kind: type[BaseException] | None, error: BaseException | None, trace: TracebackType | None) -> None:
        with contextlib.suppress(Error) if kind is not None else contextlib.nullcontext():
            self._client.stop_session(self.identifier)
            self._client.destroy_session(self.identifier)

    def send(self, message: Mapping[str, Any], *, category: int | str, type: int | str, wait: bool = True) -> None:
        """To this session."""
        self._client.send_message(message, category=category, type=type, sessions=[self.identifier], wait=wait)
