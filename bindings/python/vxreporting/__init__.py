"""Reports into the audio-telemetry service.

    import vxreporting

    with vxreporting.Client() as client:
        with client.session(42, service_type="longformaudio") as session:
            session.send({"gain": 0.5}, category="Session_Setup", type="Start")

AsyncClient is the same for asyncio. Every failure is a vxreporting.Error with a sentence for people. Both clients are for
one thread, wait no longer than their timeout, and belong to the process that made them: after a fork the child makes its
own.
"""
from ._blocking import Client, Session
from ._asyncio import AsyncClient, AsyncSession
from ._errors import (BufferFull, ConnectionLost, EncodingError, Error, MessageRefused, NotConnected, ProtocolError,
                      ServiceError, TimedOut)
from ._link import Counters
from ._vocabulary import Area, Kind, MessageType, Reporter, ServiceType

__version__ = "0.1.0"
__all__ = ["Area", "AsyncClient", "AsyncSession", "BufferFull", "Client", "ConnectionLost", "Counters", "EncodingError",
           "Error", "Kind", "MessageRefused", "MessageType", "NotConnected", "ProtocolError", "Reporter", "ServiceError",
           "ServiceType", "Session", "TimedOut"]
