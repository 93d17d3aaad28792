"""The numbers of the protocol, and the names that stand for them."""
import dataclasses
import enum
from collections.abc import Iterable, Mapping
from typing import Any, TypeVar

from ._errors import EncodingError


class ServiceType(enum.IntEnum):
    GENERIC, ONDI, TELEPHONY, HAPTICS, ALARMS, STANDALONE, SOUNDAUTOCONFIG, LONGFORMAUDIO, NONLONGFORMAUDIO, \
        AUDIODEVICEUSAGE, ALERTS, TEST, APIUSAGE = range(13)


class MessageType(enum.IntEnum):
    GENERIC, START, STOP, SETUP, ERROR, ISSUEDETECTOR, RUNNINGTIME = range(7)


class Area(enum.IntEnum):
    """The part of a category that says where; add a Kind to it."""
    SESSION, DSP, HAL, ROUTING, TOOLBOX = 0x08000000, 0x10000000, 0x20000000, 0x40000000, 0x80000000


class Kind(enum.IntEnum):
    GENERIC, RECORD, PLAYBACK, PLAYBACKANDRECORD, SETUP, CLIENTREQUEST, ROUTECHANGE, ERROR, CHANNELREPORTING, \
        PERFORMANCE, VOLUME = range(1, 12)


@dataclasses.dataclass(frozen=True)
class Reporter:
    """What the service knows of a session; an unknown one is 0 and 65535."""
    identifier: int
    service_type: int


class Operation(enum.IntEnum):
    CREATE, SET_TYPE, GET_TYPE, CONFIGURE, START, SEND, STOP, DESTROY, VALIDATE, REPORTERS = range(1, 11)


_E = TypeVar("_E", bound=enum.IntEnum)


def _named(what: str, names: type[_E], name: str) -> _E:
    try:
        return names[name.replace("_", "").upper()]
    except KeyError:
        known = ", ".join(n.lower() for n in names.__members__)
        raise EncodingError(f"{name!r} is no {what} (there are: {known})") from None


def _within(what: str, value: Any, first: int, last: int) -> int:
    if isinstance(value, bool) or not isinstance(value, int) or not first <= value <= last:
        raise EncodingError(f"{what} must be an integer from {first} to {last}, not {value!r}")
    return int(value)


def identifier_of(value: int) -> int:
    return _within("a session's identifier", value, -2**63, 2**63 - 1)


def identifiers_of(values: Iterable[int] | None) -> list[int] | None:
    return None if values is None else [identifier_of(v) for v in values]


def service_type_of(value: int | str) -> int:
    """A number, or a name: "longformaudio"."""
    return _within("a service type", _named("service type", ServiceType, value) if isinstance(value, str) else value, 0, 65535)


def message_type_of(value: int | str) -> int:
    """A number, or a name: "Start"."""
    return _within("a message's type", _named("message type", MessageType, value) if isinstance(value, str) else value, 0, 65535)


def category_of(value: int | str) -> int:
    """A number, or names: "Session_Setup", "Playback"."""
    if isinstance(value, str):
        area, _, kind = value.rpartition("_")
        value = (_named("area", Area, area) if area else 0) + _named("kind of category", Kind, kind)
    return _within("a category", value, 0, 2**32 - 1)


def dictionary_of(what: str, value: Mapping[str, Any]) -> Mapping[str, Any]:
    if not isinstance(value, Mapping):
        raise EncodingError(f"{what} must be a dictionary, not {value!r}")
    return value
