"""A client of cvdbserver in Python 3, written from docs/protocol.md alone.

It uses the standard library only. One Client is one TCP connection; its
methods send one request each and return the decoded answer. The encoders
and decoders are public so that tests can also build requests by hand,
including requests the server must reject.

    with Client("127.0.0.1", port) as c:
        c.connect("demo")
        c.set_cfg_part("layout", {"a": 1})
        print(c.get_cfg_part("layout"))
"""

from __future__ import annotations

import dataclasses
import json
import socket
import struct
from typing import Callable, Iterable, Iterator, Optional

# --- Frames -------------------------------------------------------------------

KIND_REQUEST = 0
KIND_ANSWER = 1
KIND_PROGRESS = 2
KIND_PROGRESS_END = 3
KIND_REFUSED = 4
KIND_BYE = 5

KIND_NAMES = {
    KIND_REQUEST: "Request",
    KIND_ANSWER: "Answer",
    KIND_PROGRESS: "Progress",
    KIND_PROGRESS_END: "ProgressEnd",
    KIND_REFUSED: "Refused",
    KIND_BYE: "Bye",
}

# The largest value of the length field: tag, kind and one gibibyte of payload.
MAX_BODY = (1 << 30) + 2
MAX_PAYLOAD = MAX_BODY - 2

# Command tags.
PING_PONG = 1
CONNECT = 3
GET_CFG_PART = 4
SET_CFG_PART = 5
CFG_IDS = 6
GET_DATA = 7
SET_DATA = 8
GET_PACK_INFOS = 9
GET_PACK_INFO = 10
UPDATE_PACK_INFO = 11
SAVE_PACK = 12
CHANGE_DOC_ID = 13
GET_PACK = 14
ERASE_PACK = 15
BACKUP = 16
RESTORE = 17
CLEANUP = 18
DB_NAMES = 19

COMMAND_NAMES = {
    PING_PONG: "PingPong",
    CONNECT: "Connect",
    GET_CFG_PART: "GetCfgPart",
    SET_CFG_PART: "SetCfgPart",
    CFG_IDS: "CfgIds",
    GET_DATA: "GetData",
    SET_DATA: "SetData",
    GET_PACK_INFOS: "GetPackInfos",
    GET_PACK_INFO: "GetPackInfo",
    UPDATE_PACK_INFO: "UpdatePackInfo",
    SAVE_PACK: "SavePack",
    CHANGE_DOC_ID: "ChangeDocId",
    GET_PACK: "GetPack",
    ERASE_PACK: "ErasePack",
    BACKUP: "Backup",
    RESTORE: "Restore",
    CLEANUP: "Cleanup",
    DB_NAMES: "DBNames",
}

# Connect's open modes.
OPEN_OR_CREATE = 0
OPEN_EXISTING = 1
BIND_ONLY = 2

# Use entry states.
OPEN_FOR_EDIT = 0
LOCK_FOR_UPLOAD = 2
CLOSE_EDIT = 100
END_UPLOAD = 101

INT32_MIN = -(1 << 31)
INT64_MIN = -(1 << 63)
# The in-memory marker of an absent string field; never valid on the wire.
ABSENT_STRING = b"\x7f<absent>\x7f"

# Seconds after which the server drops a stored use entry.
USE_ENTRY_LIFETIME = 25200

FAILED_PREFIX = "DB operation failed with error: "
PROCESSING_ERROR = "Terminating client connection due to processing error"


def frame(tag: int, kind: int, payload: bytes = b"") -> bytes:
    """The bytes of one frame."""
    return struct.pack("<IBB", 2 + len(payload), tag, kind) + payload


@dataclasses.dataclass(frozen=True)
class Frame:
    tag: int
    kind: int
    payload: bytes

    def __str__(self) -> str:
        return f"{KIND_NAMES.get(self.kind, self.kind)} frame, tag {self.tag}, {len(self.payload)} payload bytes"


# --- Errors -------------------------------------------------------------------


class ProtocolError(Exception):
    """The server sent something the protocol does not allow."""


class Malformed(ProtocolError):
    """A payload that does not decode."""


class ConnectionClosed(Exception):
    """The socket ended without a Bye frame."""


class ServerBye(Exception):
    """The server ended the connection with a Bye frame."""

    def __init__(self, reason: str, tag: int = 0):
        super().__init__(reason)
        self.reason = reason
        self.tag = tag


class Refused(Exception):
    """The server refused a request whose tag it does not know."""

    def __init__(self, tag: int, text: str):
        super().__init__(text)
        self.tag = tag
        self.text = text


class ConnectFailed(Exception):
    """Connect answered failed = 1."""

    def __init__(self, text: str):
        super().__init__(text)
        self.text = text


class OperationFailed(Exception):
    """A Backup, Restore or Cleanup ended with a failure message.

    progress holds every Progress of the stream, the failure last; reason is
    the text after "DB operation failed with error: "; bye is the reason of
    the Bye that ended the connection, or None when the socket just closed.
    """

    def __init__(self, progress: list["Progress"], reason: str, bye: Optional[str]):
        super().__init__(reason)
        self.progress = progress
        self.reason = reason
        self.bye = bye


# --- Field encodings ----------------------------------------------------------


def _text(value: str | bytes) -> bytes:
    # Strings on the wire are any bytes; Python text goes as UTF-8, and bytes
    # that are not UTF-8 survive a round trip through surrogateescape.
    if isinstance(value, bytes):
        return value
    return value.encode("utf-8", "surrogateescape")


class Writer:
    """Builds a payload field by field."""

    def __init__(self) -> None:
        self._parts: list[bytes] = []

    def bytes(self) -> bytes:
        return b"".join(self._parts)

    def raw(self, data: bytes) -> "Writer":
        self._parts.append(data)
        return self

    def u8(self, v: int) -> "Writer":
        return self.raw(struct.pack("<B", v))

    def bool(self, v: bool) -> "Writer":
        return self.u8(1 if v else 0)

    def u32(self, v: int) -> "Writer":
        return self.raw(struct.pack("<I", v))

    def i32(self, v: int) -> "Writer":
        return self.raw(struct.pack("<i", v))

    def u64(self, v: int) -> "Writer":
        return self.raw(struct.pack("<Q", v))

    def i64(self, v: int) -> "Writer":
        return self.raw(struct.pack("<q", v))

    def str(self, v: str | bytes) -> "Writer":
        data = _text(v)
        return self.u32(len(data)).raw(data)

    def blob(self, v: bytes) -> "Writer":
        """The `bytes` field: a u64 count, then the bytes."""
        return self.u64(len(v)).raw(v)

    def strlist(self, items: Iterable[str | bytes]) -> "Writer":
        items = list(items)
        self.u32(len(items))
        for item in items:
            self.str(item)
        return self

    def json_opt(self, text: Optional[str | bytes]) -> "Writer":
        """`json?` from JSON text (None: absent)."""
        if text is None:
            return self.u8(0)
        return self.u8(1).str(text)

    def pack(self, p: "Pack", check: bool = True) -> "Writer":
        if check:
            p.check()
        self.str(p.id)
        presence = 0
        for bit, (name, _) in enumerate(_PACK_FIELDS):
            if getattr(p, name) is not None:
                presence |= 1 << bit
        self.u8(presence)
        for name, kind in _PACK_FIELDS:
            value = getattr(p, name)
            if value is None:
                continue
            if kind == "str":
                self.str(value)
            elif kind == "i32":
                self.i32(value)
            else:
                self.i64(value)
        self.u32(len(p.uses))
        for u in p.uses:
            self.i32(u.state).str(u.host).str(u.user).u32(u.process).i64(u.time)
        return self

    def pack_opt(self, p: Optional["Pack"]) -> "Writer":
        if p is None:
            return self.u8(0)
        return self.u8(1).pack(p)


class Reader:
    """Reads a payload field by field; every overrun raises Malformed."""

    def __init__(self, data: bytes):
        self._data = data
        self._pos = 0

    def left(self) -> int:
        return len(self._data) - self._pos

    def _take(self, n: int) -> bytes:
        if n > self.left():
            raise Malformed(f"field of {n} bytes runs past the payload ({self.left()} left)")
        out = self._data[self._pos : self._pos + n]
        self._pos += n
        return out

    def _unpack(self, fmt: str) -> int:
        return struct.unpack(fmt, self._take(struct.calcsize(fmt)))[0]

    def u8(self) -> int:
        return self._unpack("<B")

    def bool(self) -> bool:
        v = self.u8()
        if v > 1:
            raise Malformed(f"bool of value {v}")
        return v == 1

    def u32(self) -> int:
        return self._unpack("<I")

    def i32(self) -> int:
        return self._unpack("<i")

    def u64(self) -> int:
        return self._unpack("<Q")

    def i64(self) -> int:
        return self._unpack("<q")

    def raw_str(self) -> bytes:
        return self._take(self.u32())

    def str(self) -> str:
        return self.raw_str().decode("utf-8", "surrogateescape")

    def blob(self) -> bytes:
        return self._take(self.u64())

    def strlist(self) -> list[str]:
        count = self.u32()
        # Each string takes at least its four-byte count.
        if count * 4 > self.left():
            raise Malformed(f"list of {count} strings cannot fit in {self.left()} bytes")
        return [self.str() for _ in range(count)]

    def json_opt(self) -> Optional[str]:
        present = self.u8()
        if present > 1:
            raise Malformed(f"json? presence byte {present}")
        return self.str() if present else None

    def pack(self) -> "Pack":
        p = Pack(self.str())
        presence = self.u8()
        if presence & 0x80:
            raise Malformed("pack presence bit 7 is set")
        for bit, (name, kind) in enumerate(_PACK_FIELDS):
            if presence & (1 << bit):
                if kind == "str":
                    value = self.str()
                elif kind == "i32":
                    value = self.i32()
                else:
                    value = self.i64()
                setattr(p, name, value)
        count = self.u32()
        # A use entry takes at least 24 bytes (state, three counts, time).
        if count * 24 > self.left():
            raise Malformed(f"{count} use entries cannot fit in {self.left()} bytes")
        for _ in range(count):
            p.uses.append(Use(self.i32(), self.str(), self.str(), self.u32(), self.i64()))
        return p

    def pack_opt(self) -> Optional["Pack"]:
        present = self.u8()
        if present > 1:
            raise Malformed(f"pack? presence byte {present}")
        return self.pack() if present else None

    def packlist(self) -> list["Pack"]:
        count = self.u32()
        # A pack record takes at least nine bytes (id count, presence, use count).
        if count * 9 > self.left():
            raise Malformed(f"{count} pack records cannot fit in {self.left()} bytes")
        return [self.pack() for _ in range(count)]

    def end(self) -> None:
        if self.left():
            raise Malformed(f"{self.left()} trailing bytes")


# --- Pack records -------------------------------------------------------------


@dataclasses.dataclass
class Use:
    state: int
    host: str
    user: str = ""
    process: int = 0
    # In requests INT64_MIN: the server stamps the entry.
    time: int = INT64_MIN


# The optional fields of a pack record, in the order of their presence bits.
_PACK_FIELDS = [
    ("folder", "str"),
    ("status", "i32"),
    ("name", "str"),
    ("owner", "str"),
    ("created", "i64"),
    ("modified", "i64"),
    ("doc_count", "i32"),
]


@dataclasses.dataclass
class Pack:
    """A pack record; None marks an absent field."""

    id: str
    folder: Optional[str] = None
    status: Optional[int] = None
    name: Optional[str] = None
    owner: Optional[str] = None
    created: Optional[int] = None
    modified: Optional[int] = None
    doc_count: Optional[int] = None
    uses: list[Use] = dataclasses.field(default_factory=list)

    def is_complete(self) -> bool:
        return all(getattr(self, name) is not None for name, _ in _PACK_FIELDS)

    def check(self) -> None:
        """Raises ValueError for a value the server reads as malformed."""
        for name, kind in _PACK_FIELDS:
            value = getattr(self, name)
            if value is None:
                continue
            if kind == "str" and _text(value) == ABSENT_STRING:
                raise ValueError(f"{name} holds the absent-string marker")
            if kind == "i32" and value == INT32_MIN:
                raise ValueError(f"{name} is INT32_MIN, the absent marker")
            if kind == "i64" and value == INT64_MIN:
                raise ValueError(f"{name} is INT64_MIN, the absent marker")

    def fields(self) -> dict:
        """The present fields but the use list, by name."""
        return {name: getattr(self, name) for name, _ in _PACK_FIELDS if getattr(self, name) is not None}


def encode_pack(p: Pack, check: bool = True) -> bytes:
    return Writer().pack(p, check).bytes()


# --- Progress streams ---------------------------------------------------------


@dataclasses.dataclass(frozen=True)
class Progress:
    percent: int
    text: str

    @property
    def failed(self) -> bool:
        return self.text.startswith(FAILED_PREFIX)


def decode_progress(payload: bytes) -> Progress:
    r = Reader(payload)
    p = Progress(r.u32(), r.str())
    r.end()
    return p


# --- The connection -----------------------------------------------------------


class Client:
    """One connection to the server."""

    def __init__(
        self,
        host: str = "127.0.0.1",
        port: int = 45678,
        timeout: Optional[float] = 60.0,
        receive_buffer: Optional[int] = None,
    ):
        """Connects; timeout bounds every wait for the server (None: none).
        receive_buffer sets the socket's receive buffer before it connects."""
        family, type_, proto, _, address = socket.getaddrinfo(host, port, type=socket.SOCK_STREAM)[0]
        self.sock = socket.socket(family, type_, proto)
        try:
            if receive_buffer is not None:
                self.sock.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, receive_buffer)
            self.sock.settimeout(timeout)
            self.sock.connect(address)
        except BaseException:
            self.sock.close()
            raise
        self.sock.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
        self._buffer = bytearray()
        # Set once the server has ended the connection.
        self.bye: Optional[str] = None

    def __enter__(self) -> "Client":
        return self

    def __exit__(self, *exc) -> None:
        self.close()

    def close(self) -> None:
        self.sock.close()

    # Frames.

    def send_raw(self, data: bytes) -> None:
        self.sock.sendall(data)

    def send_frame(self, tag: int, kind: int, payload: bytes = b"") -> None:
        if len(payload) > MAX_PAYLOAD:
            raise ValueError(f"payload of {len(payload)} bytes is above the limit of one frame")
        self.send_raw(frame(tag, kind, payload))

    def send_request(self, tag: int, payload: bytes = b"") -> None:
        self.send_frame(tag, KIND_REQUEST, payload)

    def _fill(self, n: int) -> bool:
        while len(self._buffer) < n:
            chunk = self.sock.recv(max(65536, n - len(self._buffer)))
            if not chunk:
                return False
            self._buffer += chunk
        return True

    def read_frame(self) -> Frame:
        """The next frame; ConnectionClosed when the socket ends first."""
        if not self._fill(4):
            if self._buffer:
                raise ConnectionClosed(f"socket ended inside a frame header ({len(self._buffer)} bytes)")
            raise ConnectionClosed("socket ended")
        (length,) = struct.unpack_from("<I", self._buffer)
        if length < 2 or length > MAX_BODY:
            raise ProtocolError(f"frame length {length} out of range")
        if not self._fill(4 + length):
            raise ConnectionClosed(f"socket ended inside a frame of {length} bytes")
        data = bytes(self._buffer[: 4 + length])
        del self._buffer[: 4 + length]
        f = Frame(data[4], data[5], data[6:])
        if f.kind == KIND_BYE:
            r = Reader(f.payload)
            self.bye = r.str()
            r.end()
        return f

    def expect_bye(self) -> str:
        """Reads the Bye that ends the connection and returns its reason."""
        f = self.read_frame()
        if f.kind != KIND_BYE:
            raise ProtocolError(f"expected a Bye, got {f}")
        if f.tag != 0:
            raise ProtocolError(f"Bye with tag {f.tag}")
        return self.bye

    def _check_common(self, f: Frame, tag: int) -> None:
        if f.kind == KIND_BYE:
            if f.tag != 0:
                raise ProtocolError(f"Bye with tag {f.tag}")
            raise ServerBye(self.bye, f.tag)
        if f.tag != tag:
            raise ProtocolError(f"{f} for a request of tag {tag}")
        if f.kind == KIND_REFUSED:
            r = Reader(f.payload)
            text = r.str()
            r.end()
            raise Refused(tag, text)

    def read_answer(self, tag: int) -> bytes:
        """The payload of the Answer to the request of that tag."""
        f = self.read_frame()
        self._check_common(f, tag)
        if f.kind != KIND_ANSWER:
            raise ProtocolError(f"expected an Answer, got {f}")
        return f.payload

    def call(self, tag: int, payload: bytes = b"") -> Reader:
        """Sends a request and returns a reader over its answer."""
        self.send_request(tag, payload)
        return Reader(self.read_answer(tag))

    def read_progress(self, tag: int) -> Iterator[Progress]:
        """The Progress frames of a stream up to its ProgressEnd.

        A failure (ProgressEnd after a failure message, then Bye or the end
        of the socket) raises OperationFailed; a Bye or end of the socket in
        the middle of a stream does too, as the end of a failed operation.
        """
        seen: list[Progress] = []
        while True:
            try:
                f = self.read_frame()
            except ConnectionClosed:
                raise OperationFailed(seen, _failure_reason(seen), None)
            if f.kind == KIND_BYE:
                raise OperationFailed(seen, _failure_reason(seen), self.bye)
            self._check_common(f, tag)
            if f.kind == KIND_PROGRESS:
                p = decode_progress(f.payload)
                seen.append(p)
                yield p
            elif f.kind == KIND_PROGRESS_END:
                if f.payload:
                    raise Malformed("ProgressEnd with a payload")
                if seen and seen[-1].failed:
                    bye = None
                    try:
                        bye = self.expect_bye()
                    except ConnectionClosed:
                        pass
                    raise OperationFailed(seen, _failure_reason(seen), bye)
                return
            else:
                raise ProtocolError(f"expected Progress or ProgressEnd, got {f}")

    def stream(
        self, tag: int, payload: bytes, on_progress: Optional[Callable[[Progress], None]] = None
    ) -> list[Progress]:
        self.send_request(tag, payload)
        out = []
        for p in self.read_progress(tag):
            out.append(p)
            if on_progress:
                on_progress(p)
        return out

    # Commands.

    def ping(self) -> None:
        self.call(PING_PONG).end()

    def connect(self, db_name: str | bytes, open_mode: int = OPEN_OR_CREATE) -> None:
        """Binds the connection to a database; ConnectFailed with the server's text."""
        r = self.call(CONNECT, Writer().str(db_name).u32(open_mode).bytes())
        failed = r.bool()
        text = r.str() if failed else None
        r.end()
        if failed:
            raise ConnectFailed(text)

    def get_cfg_part_text(self, key: str) -> Optional[str]:
        """The JSON text of a configuration part, None when there is none."""
        r = self.call(GET_CFG_PART, Writer().str(key).bytes())
        text = r.json_opt()
        r.end()
        return text

    def get_cfg_part(self, key: str):
        text = self.get_cfg_part_text(key)
        return None if text is None else json.loads(text)

    def set_cfg_part(self, key: str, data: dict) -> None:
        text = json.dumps(data, separators=(",", ":"), ensure_ascii=False)
        self.call(SET_CFG_PART, Writer().str(key).bool(False).json_opt(text).bytes()).end()

    def delete_cfg_part(self, key: str) -> None:
        self.call(SET_CFG_PART, Writer().str(key).bool(True).json_opt(None).bytes()).end()

    def cfg_ids(self, prefix: str = "") -> list[str]:
        r = self.call(CFG_IDS, Writer().str(prefix).bytes())
        keys = r.strlist()
        r.end()
        return keys

    def get_data(self, id: str, file_name: str) -> bytes:
        r = self.call(GET_DATA, Writer().str(id).str(file_name).bytes())
        content = r.blob()
        r.end()
        return content

    def set_data(self, id: str, file_name: str, content: bytes) -> None:
        self.call(SET_DATA, Writer().str(id).str(file_name).blob(content).bytes()).end()

    def get_pack_infos(self, folder: str = "") -> list[Pack]:
        r = self.call(GET_PACK_INFOS, Writer().str(folder).bytes())
        packs = r.packlist()
        r.end()
        return packs

    def get_pack_info(self, id: str) -> Optional[Pack]:
        r = self.call(GET_PACK_INFO, Writer().str(id).bytes())
        p = r.pack_opt()
        r.end()
        return p

    def update_pack_info(self, pack: Pack) -> Optional[Pack]:
        r = self.call(UPDATE_PACK_INFO, encode_pack(pack))
        p = r.pack_opt()
        r.end()
        return p

    def save_pack(self, pack: Pack, content: bytes) -> None:
        self.call(SAVE_PACK, Writer().pack(pack).blob(content).bytes()).end()

    def change_doc_id(self, old_id: str, new_id: str) -> None:
        self.call(CHANGE_DOC_ID, Writer().str(old_id).str(new_id).bytes()).end()

    def get_pack(self, pack: Pack | str) -> tuple[Optional[Pack], bytes]:
        if isinstance(pack, str):
            pack = Pack(pack)
        r = self.call(GET_PACK, encode_pack(pack))
        p = r.pack_opt()
        content = r.blob()
        r.end()
        return p, content

    def erase_pack(self, id: str) -> None:
        self.call(ERASE_PACK, Writer().str(id).bytes()).end()

    def backup(self, target: str = "", all: bool = False, on_progress=None) -> list[Progress]:
        return self.stream(BACKUP, Writer().str(target).bool(all).bytes(), on_progress)

    def restore(self, target: str = "", all: bool = False, on_progress=None) -> list[Progress]:
        return self.stream(RESTORE, Writer().str(target).bool(all).bytes(), on_progress)

    def cleanup(self, used_ids: Iterable[str] = (), on_progress=None) -> list[Progress]:
        return self.stream(CLEANUP, Writer().strlist(used_ids).bytes(), on_progress)

    def db_names(self) -> list[str]:
        r = self.call(DB_NAMES)
        names = r.strlist()
        r.end()
        return names


def _failure_reason(seen: list[Progress]) -> str:
    if seen and seen[-1].failed:
        return seen[-1].text[len(FAILED_PREFIX) :]
    return "the connection ended before the operation did"


# --- Names --------------------------------------------------------------------


def database_key(name: str) -> str:
    """The key under which the server knows a database name."""
    key = "".join(c.lower() if "A" <= c <= "Z" else c for c in name).replace("/", "\\")
    if key in ("", "\\"):
        return "root.db"
    if key.endswith("\\"):
        key = key[:-1]
    parts = key.split("\\")
    return "\\".join([parts[0]] + [p + "_" if p == "d" else p for p in parts[1:]])


def backup_file_name(key: str) -> str:
    """The default backup file name of a database key."""
    return key.replace("-", "--").replace("_", "-_").replace("\\", "_") + ".cvbak"
