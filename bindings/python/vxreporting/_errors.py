"""What can go wrong. The text of each is a sentence for people."""


class Error(Exception):
    """Any failure of this package."""


class NotConnected(Error):
    """There is no connection to the service, and the call was not made."""


class ConnectionLost(Error):
    """The connection ended before the answer came. The call may have run or not; it is not made again."""


class ProtocolError(ConnectionLost):
    """The service sent something that is not the protocol; the connection was given up."""


class TimedOut(Error, TimeoutError):
    """The answer has not come in time. If it comes later, it is ignored."""


class BufferFull(Error):
    """Too much waits to be written or answered; nothing of the call was kept."""


class EncodingError(Error, ValueError):
    """An argument cannot be sent; nothing was done."""


class ServiceError(Error):
    """The service answered with an error; the codes are those of docs/protocol.md."""

    def __init__(self, code: int, text: str) -> None:
        super().__init__(f"{text} (error {code})")
        self.code = code


class MessageRefused(Error):
    """The service refused a message: reporting is switched off."""

    def __init__(self, domain: str, code: int) -> None:
        super().__init__(f"the service refused the message ({domain}, code {code})")
        self.domain = domain
        self.code = code
