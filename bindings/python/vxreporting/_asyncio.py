"""The client for asyncio."""
import asyncio
import contextlib
from collections.abc import Callable, Iterable, Mapping
from types import TracebackType
from typing import Any, Self

from . import _vocabulary as vocabulary
from ._errors import Error, TimedOut
from ._link import Call, Counters, Link
from ._vocabulary import Operation, Reporter


class AsyncClient:
    """One client of the service, for one event loop. Arguments as those of Client; with keep_sessions the loop reconnects by
    itself."""

    def __init__(self, socket_path: str | None = None, *, timeout: float = 5.0, keep_sessions: bool = False,
                 max_buffered_bytes: int = 1 << 20, max_pending_calls: int = 65536) -> None:
        self.timeout = timeout
        self._link = Link(socket_path, keep_sessions, max_buffered_bytes, max_pending_calls)
        self._loop: asyncio.AbstractEventLoop | None = None
        self._watched = -1
        self._writing = False
        self._retry: asyncio.TimerHandle | None = None
        self._changed: asyncio.Future[None] | None = None
        self._failed: Error | None = None

    async def connect(self) -> Self:
        """Waits for the service's hello."""
        self._loop = asyncio.get_running_loop()
        self._link.open()
        self._watch()
        try:
            if self._link.fileno() >= 0 or not self._link.keep_sessions:
                await self._until(lambda: self._link.greeted)
        except Error:
            if not self._link.keep_sessions:
                self._end()
                raise
        return self

    async def close(self) -> None:
        """Sends what waits, says goodbye and waits for the service to close. Safe to call twice."""
        try:
            if self._link.fileno() >= 0:
                await self._until(lambda: self._link.greeted or self._link.fileno() < 0)
                self._unwatch()
                self._link.say_goodbye()
                self._watch()
                await self._until(lambda: self._link.fileno() < 0)
        finally:
            self._end()

    async def __aenter__(self) -> Self:
        return await self.connect()

    async def __aexit__(self, kind: type[BaseException] | None, error: BaseException | None,
                        trace: TracebackType | None) -> None:
        if kind is None:
            try:
                await self.flush()
            finally:
                await self.close()
        else:
            with contextlib.suppress(Error):
                await self.close()

    @property
    def connected(self) -> bool:
        return self._link.greeted

    @property
    def counters(self) -> Counters:
        return self._link.counters

    async def flush(self) -> None:
        """Waits until every call is answered, started sessions apart, and raises the first failure of those that nobody
        waited for."""
        if self._link.unanswered():
            await self._until(lambda: self._link.unanswered() == 0)
        failed, self._failed = self._failed, None
        if failed is not None:
            raise failed.with_traceback(None)

    def session(self, identifier: int, *, service_type: int | str = 0,
                configuration: Mapping[str, Any] | None = None) -> "AsyncSession":
        """A session for an async with statement: created, set up and started there, stopped and destroyed at its end."""
        return AsyncSession(self, identifier, service_type, configuration)

    async def create_session(self, identifier: int) -> bool:
        return bool(await self._call(Operation.CREATE, vocabulary.identifier_of(identifier)))

    async def set_service_type(self, identifier: int, service_type: int | str) -> bool:
        return bool(await self._call(Operation.SET_TYPE, vocabulary.service_type_of(service_type),
                                     vocabulary.identifier_of(identifier)))

    async def service_type(self, identifier: int) -> int:
        """65535 when there is no such session."""
        return int(await self._call(Operation.GET_TYPE, vocabulary.identifier_of(identifier)))

    async def configure(self, identifier: int, configuration: Mapping[str, Any]) -> bool:
        return bool(await self._call(Operation.CONFIGURE, vocabulary.dictionary_of("a configuration", configuration),
                                     vocabulary.identifier_of(identifier)))

    def start_session(self, identifier: int) -> Call:
        """Does not wait: a start is answered when the session is stopped. The call's `done` says whether it is."""
        call = self._link.call(Operation.START, vocabulary.identifier_of(identifier))
        self._step()
        return call

    def post_message(self, message: Mapping[str, Any], *, category: int | str, type: int | str,
                     sessions: Iterable[int] | None = None) -> None:
        """As send_message(), without waiting: a failure is raised by the next flush()."""
        self._send(message, category, type, sessions).on_done = self._note_failure
        self._step()

    async def send_message(self, message: Mapping[str, Any], *, category: int | str, type: int | str,
                           sessions: Iterable[int] | None = None) -> None:
        """To these sessions, or to all that are started."""
        await self._answer(self._send(message, category, type, sessions))

    async def stop_session(self, identifier: int) -> bool:
        return bool(await self._call(Operation.STOP, vocabulary.identifier_of(identifier)))

    async def destroy_session(self, identifier: int) -> bool:
        return bool(await self._call(Operation.DESTROY, vocabulary.identifier_of(identifier)))

    async def validate(self, identifier: int) -> Reporter:
        reporter = await self._call(Operation.VALIDATE, vocabulary.identifier_of(identifier))
        assert isinstance(reporter, Reporter)
        return reporter

    async def reporters(self) -> list[int]:
        """The identifiers of all clients' sessions."""
        return list(await self._call(Operation.REPORTERS))

    def _send(self, message: Mapping[str, Any], category: int | str, type: int | str,
              sessions: Iterable[int] | None) -> Call:
        return self._link.call(Operation.SEND, vocabulary.dictionary_of("a message", message),
                               vocabulary.category_of(category), vocabulary.message_type_of(type),
                               vocabulary.identifiers_of(sessions))

    def _note_failure(self, call: Call) -> None:
        self._failed = self._failed or call.error

    async def _call(self, operation: Operation, *arguments: Any) -> Any:
        return await self._answer(self._link.call(operation, *arguments))

    async def _answer(self, call: Call) -> Any:
        answered: asyncio.Future[None] = asyncio.get_running_loop().create_future()
        call.on_done = lambda _: answered.done() or answered.set_result(None)
        self._step()
        try:
            await asyncio.wait_for(answered, self.timeout)
        except asyncio.TimeoutError:
            raise self._timed_out() from None
        return call.result()

    async def _until(self, finished: Callable[[], bool]) -> None:
        end = asyncio.get_running_loop().time() + self.timeout
        self._step()
        while not finished():
            if self._link.fileno() < 0 and self._link.retry_in() is None:
                raise (self._link.ended or Error("not connected")).with_traceback(None)
            self._changed = self._changed or asyncio.get_running_loop().create_future()
            try:
                await asyncio.wait_for(asyncio.shield(self._changed), end - asyncio.get_running_loop().time())
            except asyncio.TimeoutError:
                raise self._timed_out() from None

    def _timed_out(self) -> TimedOut:
        return TimedOut(f"no answer from the service in {self.timeout} s" +
                        (f" ({self._link.ended})" if self._link.retry_in() is not None else ""))

    def _step(self) -> None:
        """The loop calls this when the descriptor is ready or a connection is due; methods do when there is something new."""
        self._unwatch()
        self._link.step()
        self._watch()
        if self._changed is not None and not self._changed.done():
            self._changed.set_result(None)
        self._changed = None

    def _unwatch(self) -> None:
        """The descriptor may be closed below: nobody may look at it then."""
        if self._loop is None:
            return
        if self._watched >= 0:
            self._loop.remove_reader(self._watched)
            self._loop.remove_writer(self._watched)
        if self._retry is not None:
            self._retry.cancel()
        self._watched, self._retry = -1, None

    def _watch(self) -> None:
        if self._loop is None:
            return
        self._watched, retry = self._link.fileno(), self._link.retry_in()
        if self._watched >= 0:
            self._loop.add_reader(self._watched, self._step)
            if self._link.wants_write():
                self._loop.add_writer(self._watched, self._step)
        elif retry is not None:
            self._retry = self._loop.call_later(retry, self._step)

    def _end(self) -> None:
        self._unwatch()
        self._link.close()
        if self._changed is not None and not self._changed.done():
            self._changed.set_result(None)
        self._changed = None


class AsyncSession:
    """A session of AsyncClient.session()."""

    def __init__(self, client: AsyncClient, identifier: int, service_type: int | str,
                 configuration: Mapping[str, Any] | None) -> None:
        self.identifier = vocabulary.identifier_of(identifier)
        self._client = client
        self._service_type = vocabulary.service_type_of(service_type)
        self._configuration = configuration

    async def __aenter__(self) -> Self:
        await self._client.create_session(self.identifier)
        await self._client.set_service_type(self.identifier, self._service_type)
        if self._configuration is not None:
            await self._client.configure(self.identifier, self._configuration)
        self._client.start_session(self.identifier)
        return self

    async def __aexit__(self, kind: type[BaseException] | None, error: BaseException | None,
                        trace: TracebackType | None) -> None:
        with contextlib.suppress(Error) if kind is not None else contextlib.nullcontext():
            await self._client.stop_session(self.identifier)
            await self._client.destroy_session(self.identifier)

    async def send(self, message: Mapping[str, Any], *, category: int | str, type: int | str) -> None:
        """To this session."""
        await self._client.send_message(message, category=category, type=type, sessions=[self.identifier])

    def post(self, message: Mapping[str, Any], *, category: int | str, type: int | str) -> None:
        """As send(), without waiting: a failure is raised by the client's next flush()."""
        self._client.post_message(message, category=category, type=type, sessions=[self.identifier])
