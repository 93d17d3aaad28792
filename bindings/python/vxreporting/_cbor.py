"""The part of CBOR (RFC 8949) that the protocol uses: definite lengths, integers, text, arrays, dictionaries with text keys,
booleans, floating numbers, dates (tag 1); null only as a direct element of a frame."""
import datetime
import math
import numbers
import struct
from collections.abc import Mapping
from typing import Any

from ._errors import EncodingError, ProtocolError

_MAX_NESTING = 32  # below the frame's array
_INTEGER, _NEGATIVE, _TEXT, _ARRAY, _DICTIONARY, _TAG, _SIMPLE = 0, 1, 3, 4, 5, 6, 7
_SIMPLE_VALUES = {20: False, 21: True}
_FLOATS = {25: ">e", 26: ">f", 27: ">d"}


def _head(major: int, n: int) -> bytes:
    if n < 24:
        return bytes((major << 5 | n,))
    width = 0 if n < 1 << 8 else 1 if n < 1 << 16 else 2 if n < 1 << 32 else 3
    return bytes((major << 5 | 24 + width,)) + n.to_bytes(1 << width, "big")


def _text(value: str) -> bytes:
    try:
        data = value.encode()
    except UnicodeEncodeError:
        raise EncodingError(f"the text {value!r} is not Unicode") from None
    return _head(_TEXT, len(data)) + data


def _put(out: list[bytes], value: Any, levels: int) -> None:
    if isinstance(value, bool):
        out.append(b"\xf5" if value else b"\xf4")
    elif isinstance(value, str):
        out.append(_text(value))
    elif isinstance(value, numbers.Integral):
        n = int(value)
        if not -2**63 <= n < 2**64:
            raise EncodingError(f"the integer {n} needs more than 64 bits")
        out.append(_head(_INTEGER, n) if n >= 0 else _head(_NEGATIVE, -1 - n))
    elif isinstance(value, numbers.Real):
        out.append(b"\xfb" + struct.pack(">d", float(value)))
    elif isinstance(value, datetime.datetime):
        out.append(b"\xc1\xfb" + struct.pack(">d", value.timestamp()))
    elif isinstance(value, (Mapping, list, tuple)):
        if levels == 0:
            raise EncodingError(f"nested deeper than {_MAX_NESTING} levels")
        if isinstance(value, Mapping):
            out.append(_head(_DICTIONARY, len(value)))
            for key, element in value.items():
                if not isinstance(key, str):
                    raise EncodingError(f"the key {key!r} is not a text")
                out.append(_text(key))
                _put(out, element, levels - 1)
        else:
            out.append(_head(_ARRAY, len(value)))
            for element in value:
                _put(out, element, levels - 1)
    else:
        raise EncodingError(f"a {type(value).__name__} cannot be sent: {value!r:.80} (booleans, numbers, texts, datetimes, "
                            "lists and dictionaries of them can)")


def frame(*elements: Any) -> bytes:
    """A frame with its length. None stands for an argument that is left out."""
    out = [_head(_ARRAY, len(elements))]
    for element in elements:
        if element is None:
            out.append(b"\xf6")
        else:
            _put(out, element, _MAX_NESTING)
    body = b"".join(out)
    return struct.pack("<I", len(body)) + body


class _Reader:
    def __init__(self, data: bytes) -> None:
        self.data = data
        self.at = 0

    def take(self, count: int) -> bytes:
        if count > len(self.data) - self.at:
            raise ProtocolError("the service sent a frame that ends too early")
        self.at += count
        return self.data[self.at - count:self.at]

    def item(self, levels: int, null_allowed: bool = False) -> Any:
        first = self.take(1)[0]
        major, low = first >> 5, first & 31
        if first == 0xf6 and null_allowed:
            return None
        if major == _SIMPLE:
            if low in _FLOATS:
                return struct.unpack(_FLOATS[low], self.take(1 << low - 24))[0]
            if low in _SIMPLE_VALUES:
                return _SIMPLE_VALUES[low]
            raise ProtocolError("the service sent a simple value that the protocol has not")
        if low > 27:
            raise ProtocolError("the service sent an item without a length")
        n = low if low < 24 else int.from_bytes(self.take(1 << low - 24), "big")
        if major == _INTEGER:
            return n
        if major == _NEGATIVE and n < 2**63:
            return -1 - n
        if major == _TEXT:
            try:
                return self.take(n).decode()
            except UnicodeDecodeError:
                raise ProtocolError("the service sent a text that is not UTF-8") from None
        if major == _TAG and n == 1:
            return self.date()
        if major not in (_ARRAY, _DICTIONARY):
            raise ProtocolError("the service sent an item of a kind that the protocol has not")
        if levels == 0:
            raise ProtocolError("the service sent a frame that nests too deep")
        if major == _ARRAY:
            return [self.item(levels - 1) for _ in range(n)]
        return self.dictionary(n, levels - 1)

    def date(self) -> datetime.datetime:
        seconds = self.item(0)
        if type(seconds) in (int, float) and math.isfinite(seconds):
            try:
                return datetime.datetime.fromtimestamp(seconds, datetime.timezone.utc)
            except (OverflowError, OSError, ValueError):
                pass
        raise ProtocolError("the service sent a date that is none")

    def dictionary(self, count: int, levels: int) -> dict[str, Any]:
        result: dict[str, Any] = {}
        for _ in range(count):
            key = self.item(0)
            if not isinstance(key, str) or key in result:
                raise ProtocolError("the service sent a dictionary with a key that is no text, or there twice")
            result[key] = self.item(levels)
        return result


def elements(body: bytes) -> list[Any]:
    """Of the frame with this body."""
    reader = _Reader(body)
    if not body or body[0] >> 5 != _ARRAY or body[0] & 31 > 23:
        raise ProtocolError("the service sent a frame that is no short array")
    result = [reader.item(_MAX_NESTING, null_allowed=True) for _ in range(reader.take(1)[0] & 31)]
    if reader.at != len(body):
        raise ProtocolError("the service sent bytes behind a frame's array")
    return result
