#!/usr/bin/env python3
"""The Python client against the real cvdbserver.

    python3 tests/pyclient/test_protocol.py PATH/TO/cvdbserver [unittest options]
    CVDB_SERVER=PATH/TO/cvdbserver python3 tests/pyclient/test_protocol.py

Every command of docs/protocol.md runs at least once and every frame kind
is seen at least once; each test checks what the document promises. One
server serves most tests, each on databases of its own; the tests that stop
a server start their own. Cases where the server does something other than
what the document says are marked expectedFailure with the point named.
"""

from __future__ import annotations

import io
import json
import os
import re
import shutil
import signal
import socket
import sqlite3
import struct
import sys
import tempfile
import time
import unittest
import zipfile

# Nothing written into the source tree.
sys.dont_write_bytecode = True
sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))

from cvdbclient import (  # noqa: E402
    BACKUP,
    BIND_ONLY,
    CFG_IDS,
    CHANGE_DOC_ID,
    CLEANUP,
    CLOSE_EDIT,
    CONNECT,
    END_UPLOAD,
    ERASE_PACK,
    GET_CFG_PART,
    GET_DATA,
    GET_PACK,
    GET_PACK_INFO,
    GET_PACK_INFOS,
    INT32_MIN,
    INT64_MIN,
    ABSENT_STRING,
    KIND_ANSWER,
    KIND_BYE,
    KIND_PROGRESS,
    KIND_PROGRESS_END,
    KIND_REQUEST,
    LOCK_FOR_UPLOAD,
    MAX_BODY,
    OPEN_EXISTING,
    OPEN_FOR_EDIT,
    PING_PONG,
    PROCESSING_ERROR,
    RESTORE,
    SAVE_PACK,
    SET_CFG_PART,
    SET_DATA,
    UPDATE_PACK_INFO,
    COMMAND_NAMES,
    Client,
    ConnectFailed,
    ConnectionClosed,
    OperationFailed,
    Pack,
    Progress,
    Reader,
    Refused,
    ServerBye,
    Use,
    Writer,
    backup_file_name,
    database_key,
    encode_pack,
    frame,
)
from server import ServerProcess  # noqa: E402

SERVER_BINARY = os.environ.get("CVDB_SERVER", "")

# The one server most tests share; started by setUpModule.
server: ServerProcess = None  # type: ignore[assignment]


def setUpModule() -> None:
    global server
    if not SERVER_BINARY:
        raise unittest.SkipTest("no server: give its path as the first argument or in CVDB_SERVER")
    server = ServerProcess(SERVER_BINARY)


def tearDownModule() -> None:
    if server is None:
        return
    status = server.stop()
    server.remove()
    if status != 0:
        raise AssertionError(f"the shared server exited with status {status}")


def complete_pack(id: str, folder: str = "f", status: int = 1, **kw) -> Pack:
    fields = dict(name="name of " + id, owner="anna", created=1700000000, modified=1700003600, doc_count=42)
    fields.update(kw)
    return Pack(id, folder=folder, status=status, **fields)


def db_folder(root: str, name: str) -> str:
    """The folder of a database below the root (docs/configuration.md)."""
    return os.path.join(root, *database_key(name).split("\\"))


class ServerTest(unittest.TestCase):
    """Connections to the shared server, closed after each test."""

    server: ServerProcess

    def setUp(self) -> None:
        self.server = server

    def client(self, db: str | None = None, **kw) -> Client:
        c = Client("127.0.0.1", self.server.port, **kw)
        self.addCleanup(c.close)
        if db is not None:
            c.connect(db)
        return c

    def db(self, suffix: str = "") -> str:
        """A database name of this test's own."""
        return "py_" + self._testMethodName.lower() + suffix

    def assertBye(self, c: Client, reason: str | None = None, prefix: str | None = None) -> str:
        """The next frame is a Bye (tag 0) and nothing follows it."""
        f = c.read_frame()
        self.assertEqual(f.kind, KIND_BYE, f"expected a Bye, got {f}")
        self.assertEqual(f.tag, 0)
        if reason is not None:
            self.assertEqual(c.bye, reason)
        if prefix is not None:
            self.assertTrue(c.bye.startswith(prefix), c.bye)
        with self.assertRaises((ConnectionClosed, ConnectionResetError)):
            c.read_frame()
        return c.bye

    def assertFailsWithBye(self, fn, reason: str = PROCESSING_ERROR) -> None:
        with self.assertRaises(ServerBye) as cm:
            fn()
        self.assertEqual(cm.exception.reason, reason)

    def texts(self, progress: list[Progress]) -> list[str]:
        return [p.text for p in progress]


# --- Frames ---------------------------------------------------------------------


class WorkedExamplesTest(ServerTest):
    """The byte sequences of the document's worked examples, on the wire."""

    def exchange(self, c: Client, request: bytes, answer_length: int) -> bytes:
        c.send_raw(request)
        data = b""
        while len(data) < answer_length:
            chunk = c.sock.recv(answer_length - len(data))
            self.assertTrue(chunk, f"socket ended after {data.hex(' ')}")
            data += chunk
        return data

    def test_ping_connect_and_get_cfg_part(self) -> None:
        c = self.client()
        self.assertEqual(
            self.exchange(c, bytes.fromhex("02 00 00 00 01 00"), 6), bytes.fromhex("02 00 00 00 01 01"))
        # "demo" must not exist for the first answer.
        self.assertNotIn("demo", c.db_names())
        self.assertEqual(
            self.exchange(c, bytes.fromhex("0e 00 00 00 03 00 04 00 00 00 64 65 6d 6f 01 00 00 00"), 39),
            bytes.fromhex("23 00 00 00 03 01 01 1c 00 00 00") + b"Database demo does not exist")
        self.assertEqual(
            self.exchange(c, bytes.fromhex("0e 00 00 00 03 00 04 00 00 00 64 65 6d 6f 00 00 00 00"), 7),
            bytes.fromhex("03 00 00 00 03 01 00"))
        get_layout = bytes.fromhex("0c 00 00 00 04 00 06 00 00 00 6c 61 79 6f 75 74")
        self.assertEqual(self.exchange(c, get_layout, 7), bytes.fromhex("03 00 00 00 04 01 00"))
        c.set_cfg_part("layout", {"a": 1})
        self.assertEqual(
            self.exchange(c, get_layout, 18),
            bytes.fromhex("0e 00 00 00 04 01 01 07 00 00 00 7b 22 61 22 3a 31 7d"))

    def test_get_pack_that_opens_for_editing(self) -> None:
        documented = bytes.fromhex(
            "2c 00 00 00 0e 00  02 00 00 00 50 31  00  01 00 00 00  00 00 00 00"
            " 03 00 00 00 77 73 31  04 00 00 00 61 6e 6e 61  92 10 00 00  00 00 00 00 00 00 00 80")
        request = Pack("P1", uses=[Use(OPEN_FOR_EDIT, "ws1", "anna", 4242)])
        self.assertEqual(frame(GET_PACK, KIND_REQUEST, encode_pack(request)), documented)

        c = self.client(self.db())
        c.save_pack(complete_pack("P1"), b"pack content")
        before = int(time.time())
        c.send_raw(documented)
        r = Reader(c.read_answer(GET_PACK))
        record, content = r.pack_opt(), r.blob()
        r.end()
        self.assertEqual(content, b"pack content")
        self.assertTrue(record.is_complete())
        self.assertEqual(len(record.uses), 1)
        use = record.uses[0]
        self.assertEqual((use.state, use.host, use.user, use.process), (OPEN_FOR_EDIT, "ws1", "anna", 4242))
        self.assertLessEqual(before - 1, use.time)
        self.assertLessEqual(use.time, time.time() + 1)

    def test_backup_stream_start_and_end(self) -> None:
        c = self.client(self.db())
        c.send_request(BACKUP, Writer().str("").bool(False).bytes())
        start = bytes.fromhex("25 00 00 00 10 02 00 00 00 00 1b 00 00 00") + b"Starting Database Backup..."
        self.assertEqual(self.exchange(c, b"", len(start)), start)
        frames = []
        while not frames or frames[-1].kind != KIND_PROGRESS_END:
            frames.append(c.read_frame())
        self.assertTrue(all(f.kind == KIND_PROGRESS and f.tag == BACKUP for f in frames[:-1]))
        self.assertEqual(frame(frames[-1].tag, frames[-1].kind, frames[-1].payload), bytes.fromhex("02 00 00 00 10 03"))

    def test_unknown_tag_then_end_of_connection(self) -> None:
        c = self.client()
        refused = bytes.fromhex("1b 00 00 00 02 04 15 00 00 00") + b"Unknown command tag 2"
        self.assertEqual(self.exchange(c, bytes.fromhex("02 00 00 00 02 00"), len(refused)), refused)
        # A command that needs a database, on a connection without one.
        bye = bytes.fromhex("3b 00 00 00 00 05 35 00 00 00") + PROCESSING_ERROR.encode()
        self.assertEqual(self.exchange(c, frame(GET_CFG_PART, KIND_REQUEST, Writer().str("x").bytes()), len(bye)), bye)


class FramingTest(ServerTest):
    def test_requests_sent_together_are_answered_in_order(self) -> None:
        c = self.client(self.db())
        blob = bytes(range(256)) * 64
        c.send_raw(
            frame(SET_DATA, KIND_REQUEST, Writer().str("X").str("f").blob(blob).bytes())
            + frame(GET_DATA, KIND_REQUEST, Writer().str("X").str("f").bytes())
            + frame(SET_DATA, KIND_REQUEST, Writer().str("X").str("f").blob(b"second").bytes())
            + frame(GET_DATA, KIND_REQUEST, Writer().str("X").str("f").bytes())
            + frame(PING_PONG, KIND_REQUEST))
        self.assertEqual(c.read_answer(SET_DATA), b"")
        self.assertEqual(Reader(c.read_answer(GET_DATA)).blob(), blob)
        self.assertEqual(c.read_answer(SET_DATA), b"")
        self.assertEqual(Reader(c.read_answer(GET_DATA)).blob(), b"second")
        self.assertEqual(c.read_answer(PING_PONG), b"")

    def test_unknown_tags_are_refused_and_the_connection_goes_on(self) -> None:
        c = self.client()
        for tag, payload in [(0, b""), (2, b""), (20, b"any payload"), (128, b"\x00" * 1000), (255, b"x")]:
            with self.subTest(tag=tag):
                c.send_request(tag, payload)
                with self.assertRaises(Refused) as cm:
                    c.read_answer(tag)
                self.assertEqual(cm.exception.text, f"Unknown command tag {tag}")
                c.ping()

    def test_a_frame_that_is_not_a_request_ends_the_connection(self) -> None:
        for kind in [1, 2, 3, 4, 5, 6, 255]:
            with self.subTest(kind=kind):
                c = self.client()
                c.send_frame(PING_PONG, kind)
                self.assertBye(c, prefix="Malformed frame: ")

    def test_a_length_out_of_range_ends_the_connection(self) -> None:
        for length in [0, 1, MAX_BODY + 1, 0xFFFFFFFF]:
            with self.subTest(length=length):
                c = self.client()
                # Only the length: the server must judge it before the body.
                c.send_raw(struct.pack("<I", length))
                self.assertBye(c, prefix="Malformed frame: ")


class AddressTest(ServerTest):
    def test_ipv6_and_ipv4_loopback(self) -> None:
        try:
            probe = socket.socket(socket.AF_INET6, socket.SOCK_STREAM)
            probe.bind(("::1", 0))
            probe.close()
        except OSError:
            self.skipTest("no IPv6 loopback on this machine")
        for host in ["::1", "127.0.0.1"]:
            with self.subTest(host=host), Client(host, self.server.port) as c:
                c.ping()


class MalformedRequestTest(ServerTest):
    """Payloads that do not decode end the connection with the command's name."""

    def assertMalformed(self, tag: int, payload: bytes, db: str | None = None) -> None:
        c = self.client(db)
        c.send_request(tag, payload)
        self.assertBye(c, prefix="Malformed request " + COMMAND_NAMES[tag])

    def test_every_command_names_itself(self) -> None:
        # One byte is too short for every request with a field and one too
        # many for the two without.
        db = self.db()
        self.client(db).close()
        for tag in COMMAND_NAMES:
            with self.subTest(command=COMMAND_NAMES[tag]):
                self.assertMalformed(tag, b"\x01", db)

    def test_field_rules(self) -> None:
        db = self.db()
        cases = {
            "trailing byte": (GET_DATA, Writer().str("X").str("f").u8(0).bytes()),
            "bool of 2": (SET_CFG_PART, Writer().str("k").u8(2).json_opt(None).bytes()),
            "bool of 255 in Backup": (BACKUP, Writer().str("").u8(255).bytes()),
            "json? presence of 2": (SET_CFG_PART, Writer().str("k").bool(False).u8(2).str("{}").bytes()),
            "str past the end": (GET_CFG_PART, Writer().u32(10).raw(b"ab").bytes()),
            "bytes past the end": (SET_DATA, Writer().str("X").str("f").u64(1 << 40).raw(b"abc").bytes()),
            "strlist count past the end": (CLEANUP, Writer().u32(1000).str("a").bytes()),
            "connect without its mode": (CONNECT, Writer().str("x").bytes()),
        }
        for label, (tag, payload) in cases.items():
            with self.subTest(label):
                self.assertMalformed(tag, payload, None if tag == CONNECT else db)

    def test_pack_record_rules(self) -> None:
        db = self.db()
        c = self.client(db)
        c.update_pack_info(complete_pack("P"))
        c.close()
        cases = {
            "presence bit 7": Writer().str("P").u8(0x80).u32(0).bytes(),
            "use count past the end": Writer().str("P").u8(0).u32(3).bytes(),
            "status INT32_MIN": encode_pack(Pack("P", status=INT32_MIN), check=False),
            "docCount INT32_MIN": encode_pack(Pack("P", doc_count=INT32_MIN), check=False),
            "created INT64_MIN": encode_pack(Pack("P", created=INT64_MIN), check=False),
            "modified INT64_MIN": encode_pack(Pack("P", modified=INT64_MIN), check=False),
        }
        for field in ["folder", "name", "owner"]:
            cases[f"{field} absent marker"] = encode_pack(Pack("P", **{field: ABSENT_STRING}), check=False)
        for label, payload in cases.items():
            with self.subTest(label):
                self.assertMalformed(UPDATE_PACK_INFO, payload, db)
        # Nothing of those requests was stored.
        self.assertEqual(self.client(db).get_pack_info("P"), complete_pack("P"))

    def test_client_refuses_to_encode_reserved_values(self) -> None:
        for p in [Pack("P", status=INT32_MIN), Pack("P", created=INT64_MIN), Pack("P", name=ABSENT_STRING)]:
            with self.subTest(p=p), self.assertRaises(ValueError):
                encode_pack(p)


# --- Connect and databases ---------------------------------------------------------


class ConnectTest(ServerTest):
    def test_open_modes(self) -> None:
        name = self.db()
        c = self.client()
        with self.assertRaises(ConnectFailed) as cm:
            c.connect(name, OPEN_EXISTING)
        self.assertEqual(cm.exception.text, f"Database {name} does not exist")
        # The connection still answers what needs no database.
        c.ping()
        self.assertNotIn(name, c.db_names())
        # ... but stays bound to the closed database.
        self.assertFailsWithBye(lambda: c.get_cfg_part("k"))

        c = self.client()
        c.connect(name)
        self.assertIn(database_key(name), c.db_names())
        c.set_cfg_part("k", {"v": 1})
        c.connect(name)  # the same database again
        self.assertEqual(c.get_cfg_part("k"), {"v": 1})

        c = self.client()
        c.connect(name, OPEN_EXISTING)
        self.assertEqual(c.get_cfg_part("k"), {"v": 1})

    def test_bind_without_opening(self) -> None:
        c = self.client()
        c.connect(self.db(), BIND_ONLY)
        c.connect(self.db(), 12345)
        self.assertNotIn(database_key(self.db()), c.db_names())

    def test_switching_databases(self) -> None:
        c = self.client(self.db("_a"))
        c.set_cfg_part("k", {"db": "a"})
        c.connect(self.db("_b"))
        self.assertIsNone(c.get_cfg_part("k"))
        c.set_cfg_part("k", {"db": "b"})
        c.connect(self.db("_a"))
        self.assertEqual(c.get_cfg_part("k"), {"db": "a"})

    def test_hierarchical_names_and_keys(self) -> None:
        c = self.client("Py_Team\\Sales\\")
        c.set_cfg_part("k", {"v": "team"})
        # Another spelling of the same key is the same database.
        self.client("py_team/sales")
        self.assertEqual(self.client("PY_TEAM\\SALES").get_cfg_part("k"), {"v": "team"})
        names = c.db_names()
        self.assertIn("py_team\\sales", [database_key(n) for n in names])

    def test_refused_names_keep_the_binding(self) -> None:
        c = self.client(self.db())
        c.set_cfg_part("k", {"v": 1})
        for name in ["a\\..\\b", "..", ".", "a/./b", "\\sales", "/sales", "a\\\\b", "sales\\\\",
                     "db.backup", "db.temp\\x", "DB.Temp", ".config", "a\x00b"]:
            with self.subTest(name=name):
                with self.assertRaises(ConnectFailed) as cm:
                    c.connect(name)
                self.assertEqual(cm.exception.text, f"Database name {name} is not valid")
                self.assertEqual(c.get_cfg_part("k"), {"v": 1})

    def test_commands_that_need_a_database(self) -> None:
        requests = {
            GET_CFG_PART: Writer().str("k").bytes(),
            SET_CFG_PART: Writer().str("k").bool(False).json_opt("{}").bytes(),
            CFG_IDS: Writer().str("").bytes(),
            GET_DATA: Writer().str("X").str("f").bytes(),
            SET_DATA: Writer().str("X").str("f").blob(b"x").bytes(),
            GET_PACK_INFOS: Writer().str("").bytes(),
            GET_PACK_INFO: Writer().str("P").bytes(),
            UPDATE_PACK_INFO: encode_pack(complete_pack("P")),
            SAVE_PACK: Writer().pack(complete_pack("P")).blob(b"").bytes(),
            CHANGE_DOC_ID: Writer().str("X").str("Y").bytes(),
            GET_PACK: encode_pack(Pack("P")),
            ERASE_PACK: Writer().str("P").bytes(),
        }
        for tag, payload in requests.items():
            with self.subTest(command=COMMAND_NAMES[tag]):
                c = self.client()
                c.ping()
                c.send_request(tag, payload)
                # No Answer: the Bye, then the end of the socket.
                self.assertBye(c, PROCESSING_ERROR)
        streams = {
            BACKUP: Writer().str("").bool(False).bytes(),
            RESTORE: Writer().str("").bool(False).bytes(),
            CLEANUP: Writer().strlist([]).bytes(),
        }
        for tag, payload in streams.items():
            with self.subTest(command=COMMAND_NAMES[tag]):
                c = self.client()
                with self.assertRaises(OperationFailed) as cm:
                    c.stream(tag, payload)
                failure = cm.exception
                self.assertEqual(failure.reason, "No database associated with current connection. Connect command failed?")
                self.assertEqual(failure.progress[-1].percent, 100)
                self.assertEqual(failure.bye, PROCESSING_ERROR)


# --- Configuration parts and data files ------------------------------------------------


class CfgPartTest(ServerTest):
    def test_store_read_replace_delete(self) -> None:
        c = self.client(self.db())
        self.assertIsNone(c.get_cfg_part_text("layout"))
        value = {"b": [1, 2.5, None, True], "a": {"nested": "ünïcode ✓"}, "": ""}
        c.set_cfg_part("layout", value)
        text = c.get_cfg_part_text("layout")
        self.assertEqual(json.loads(text), value)
        # Written compactly, whatever the order of the keys.
        self.assertEqual(text, json.dumps(json.loads(text), separators=(",", ":"), ensure_ascii=False))
        c.set_cfg_part("layout", {})
        self.assertEqual(c.get_cfg_part_text("layout"), "{}")
        c.delete_cfg_part("layout")
        self.assertIsNone(c.get_cfg_part_text("layout"))
        c.delete_cfg_part("layout")  # a missing part is no error

    def test_white_space_is_not_kept(self) -> None:
        c = self.client(self.db())
        c.call(SET_CFG_PART, Writer().str("k").bool(False).json_opt('{ "a" : [ 1 , 2 ] ,\n "b":"x y" }').bytes()).end()
        self.assertEqual(c.get_cfg_part_text("k"), '{"a":[1,2],"b":"x y"}')

    def test_requests_that_break_the_rules_store_nothing(self) -> None:
        db = self.db()
        self.client(db).set_cfg_part("k", {"v": 1})
        cases = {
            "an array": Writer().str("k").bool(False).json_opt("[1]").bytes(),
            "null": Writer().str("k").bool(False).json_opt("null").bytes(),
            "a string": Writer().str("k").bool(False).json_opt('""').bytes(),
            "no data": Writer().str("k").bool(False).json_opt(None).bytes(),
            "not JSON": Writer().str("k").bool(False).json_opt("{x").bytes(),
            "not UTF-8": Writer().str("k").bool(False).json_opt(b'{"k":"\xff"}').bytes(),
            "delete with data": Writer().str("k").bool(True).json_opt("{}").bytes(),
        }
        for label, payload in cases.items():
            with self.subTest(label):
                c = self.client(db)
                c.send_request(SET_CFG_PART, payload)
                self.assertBye(c)
                self.assertEqual(self.client(db).get_cfg_part("k"), {"v": 1})

    def test_keys_are_any_bytes(self) -> None:
        c = self.client(self.db())
        key = "a\x00b" + b"\xff\xfe".decode("utf-8", "surrogateescape")
        c.set_cfg_part(key, {"k": "v"})
        self.assertEqual(c.get_cfg_part(key), {"k": "v"})
        self.assertIsNone(c.get_cfg_part("a"))
        self.assertEqual(c.cfg_ids("a\x00"), [key])

    def test_cfg_ids_lists_keys_by_prefix_in_order(self) -> None:
        c = self.client(self.db())
        for key in ["beta", "alpha2", "alpha", "Zed", "al"]:
            c.set_cfg_part(key, {})
        self.assertEqual(c.cfg_ids("alpha"), ["alpha", "alpha2"])
        self.assertEqual(c.cfg_ids("al"), ["al", "alpha", "alpha2"])
        self.assertEqual(c.cfg_ids("nothing"), [])
        everything = c.cfg_ids("")
        self.assertEqual(everything, sorted(everything, key=lambda k: k.encode()))
        self.assertEqual(set(everything), {"beta", "alpha2", "alpha", "Zed", "al"})

    def test_cfg_ids_includes_the_ids_of_saved_packs(self) -> None:
        c = self.client(self.db())
        c.set_cfg_part("layout", {})
        c.save_pack(complete_pack("P1"), b"content")
        self.assertEqual(c.cfg_ids(""), ["P1", "layout"])
        c.erase_pack("P1")
        self.assertEqual(c.cfg_ids(""), ["layout"])

    def test_cfg_ids_leaves_out_packs_without_content(self) -> None:
        # Section 4, CfgIds: only packs with a saved content are listed.
        c = self.client(self.db())
        c.update_pack_info(complete_pack("P2"))
        self.assertNotIn("P2", c.cfg_ids(""))


class DataTest(ServerTest):
    def test_write_read_replace(self) -> None:
        c = self.client(self.db())
        self.assertEqual(c.get_data("X", "missing"), b"")
        every_byte = bytes(range(256)) * 3
        c.set_data("X", "f1", every_byte)
        c.set_data("X", "f2", b"")
        self.assertEqual(c.get_data("X", "f1"), every_byte)
        self.assertEqual(c.get_data("X", "f2"), b"")
        c.set_data("X", "f1", b"replaced")
        self.assertEqual(c.get_data("X", "f1"), b"replaced")
        self.assertEqual(c.get_data("Y", "f1"), b"")

    def test_large_content(self) -> None:
        c = self.client(self.db())
        content = os.urandom(1 << 16) * 96  # 6 MiB
        c.set_data("big", "f", content)
        self.assertEqual(c.get_data("big", "f"), content)

    def test_change_doc_id_copies(self) -> None:
        c = self.client(self.db())
        c.set_data("old", "a", b"content a")
        c.set_data("old", "b", b"content b")
        c.change_doc_id("old", "new")
        for id in ["old", "new"]:
            with self.subTest(id=id):
                self.assertEqual(c.get_data(id, "a"), b"content a")
                self.assertEqual(c.get_data(id, "b"), b"content b")


# --- Packs -----------------------------------------------------------------------


class PackRecordTest(ServerTest):
    def test_create_read_update(self) -> None:
        c = self.client(self.db())
        self.assertIsNone(c.get_pack_info("P"))
        answer = c.update_pack_info(complete_pack("P", status=7))
        # The id and status as written, nothing else.
        self.assertEqual(answer, Pack("P", status=7))
        self.assertEqual(c.get_pack_info("P"), complete_pack("P", status=7))

        answer = c.update_pack_info(Pack("P", name="renamed", folder=""))
        self.assertEqual(answer, Pack("P", status=7))
        self.assertEqual(c.get_pack_info("P"), complete_pack("P", status=7, name="renamed", folder=""))

        c.update_pack_info(Pack("P", status=-3, owner="", doc_count=0, created=-1, modified=1 << 40))
        self.assertEqual(
            c.get_pack_info("P"),
            complete_pack("P", status=-3, name="renamed", folder="", owner="", doc_count=0, created=-1,
                          modified=1 << 40))

    def test_strings_are_any_bytes(self) -> None:
        c = self.client(self.db())
        not_utf8 = "\x00" + b"\xff".decode("utf-8", "surrogateescape")
        record = complete_pack("p" + not_utf8, folder="f" + not_utf8, name="\x00ü", owner="\x00")
        c.update_pack_info(record)
        self.assertEqual(c.get_pack_info("p" + not_utf8), record)
        self.assertEqual(c.get_pack_infos("f" + not_utf8), [record])
        self.assertIsNone(c.get_pack_info("p"))

    def test_strings_kept_in_the_stored_object_must_be_utf8(self) -> None:
        # Section 2, text encodings: name, owner, host and user must be UTF-8.
        bad = b"\xff".decode("utf-8", "surrogateescape")
        cases = [("name", complete_pack("p", name=bad)), ("owner", complete_pack("p", owner=bad)),
                 ("use entry host", complete_pack("p", uses=[Use(OPEN_FOR_EDIT, "ws" + bad)])),
                 ("use entry user", complete_pack("p", uses=[Use(OPEN_FOR_EDIT, "ws", bad)]))]
        db = self.db()
        for field, record in cases:
            with self.subTest(field=field):
                c = self.client(db)
                reason = ("Malformed request UpdatePackInfo: " + ("pack " if field in ("name", "owner") else "") +
                          field + " is not valid UTF-8")
                self.assertFailsWithBye(lambda: c.update_pack_info(record), reason)
        self.assertIsNone(self.client(db).get_pack_info("p"))

    def test_id_length(self) -> None:
        db = self.db()
        c = self.client(db)
        c.update_pack_info(complete_pack("i" * 50))
        self.assertEqual(c.get_pack_info("i" * 50), complete_pack("i" * 50))
        self.assertFailsWithBye(lambda: c.update_pack_info(complete_pack("i" * 51)))
        c = self.client(db)
        self.assertFailsWithBye(lambda: c.update_pack_info(complete_pack("j", folder="f" * 51)))
        self.assertIsNone(self.client(db).get_pack_info("j"))

    def test_partial_record_for_a_missing_pack(self) -> None:
        db = self.db()
        c = self.client(db)
        self.assertFailsWithBye(lambda: c.update_pack_info(Pack("M", name="x")))
        c = self.client(db)
        # A CloseEdit is accepted and changes nothing.
        self.assertIsNone(c.update_pack_info(Pack("M", name="x", uses=[Use(CLOSE_EDIT, "ws1")])))
        self.assertIsNone(c.get_pack_info("M"))

    def test_get_pack_infos_by_folder_then_status(self) -> None:
        c = self.client(self.db())
        for id, folder, status in [("a", "f2", 5), ("b", "f1", 9), ("c", "f1", -1), ("d", "f2", 0), ("e", "f1", 3)]:
            c.update_pack_info(complete_pack(id, folder, status))
        self.assertEqual([p.id for p in c.get_pack_infos("")], ["c", "e", "b", "d", "a"])
        infos = c.get_pack_infos("f2")
        self.assertEqual([p.id for p in infos], ["d", "a"])
        self.assertEqual(infos[0], complete_pack("d", "f2", 0))
        self.assertEqual(c.get_pack_infos("f3"), [])

    def test_erase(self) -> None:
        c = self.client(self.db())
        c.save_pack(complete_pack("P"), b"content")
        c.set_data("P", "file", b"data")
        c.erase_pack("P")
        self.assertIsNone(c.get_pack_info("P"))
        self.assertEqual(c.get_pack("P"), (None, b""))
        self.assertEqual(c.get_pack_infos(""), [])
        # Its data files stay.
        self.assertEqual(c.get_data("P", "file"), b"data")
        c.erase_pack("P")  # a missing pack is no error


class PackContentTest(ServerTest):
    def test_save_and_get(self) -> None:
        c = self.client(self.db())
        self.assertEqual(c.get_pack("P"), (None, b""))
        content = bytes(range(256)) * 100
        c.save_pack(complete_pack("P"), content)
        self.assertEqual(c.get_pack("P"), (complete_pack("P"), content))
        # A partial record updates its fields and replaces the content.
        c.save_pack(Pack("P", doc_count=43), b"second")
        self.assertEqual(c.get_pack("P"), (complete_pack("P", doc_count=43), b"second"))
        # Without a use entry, the fields of a GetPack are ignored.
        self.assertEqual(c.get_pack(Pack("P", name="ignored")), (complete_pack("P", doc_count=43), b"second"))
        c.save_pack(Pack("P"), b"")
        self.assertEqual(c.get_pack("P"), (complete_pack("P", doc_count=43), b""))

    def test_save_close_edit_for_a_missing_pack_stores_nothing(self) -> None:
        c = self.client(self.db())
        c.save_pack(Pack("M", name="x", uses=[Use(CLOSE_EDIT, "ws1")]), b"content")
        self.assertEqual(c.get_pack("M"), (None, b""))

    def test_save_close_edit_with_a_complete_record_creates_the_pack(self) -> None:
        # Section 4, SavePack: a complete record creates the pack, CloseEdit
        # or not; the CloseEdit then finds no entry to remove.
        c = self.client(self.db())
        c.save_pack(complete_pack("M", uses=[Use(CLOSE_EDIT, "ws1")]), b"content")
        self.assertEqual(c.get_pack("M"), (complete_pack("M"), b"content"))

    def test_save_partial_record_for_a_missing_pack(self) -> None:
        db = self.db()
        c = self.client(db)
        self.assertFailsWithBye(lambda: c.save_pack(Pack("M", name="x"), b"content"))
        self.assertEqual(self.client(db).get_pack("M"), (None, b""))

    def test_get_pack_applies_its_record_with_a_use_entry(self) -> None:
        db = self.db()
        c = self.client(db)
        # A complete record creates the missing pack, in the same step.
        record, content = c.get_pack(complete_pack("N", uses=[Use(OPEN_FOR_EDIT, "ws1", "anna", 7)]))
        self.assertEqual(record.fields(), complete_pack("N").fields())
        self.assertEqual([(u.state, u.host) for u in record.uses], [(OPEN_FOR_EDIT, "ws1")])
        self.assertEqual(content, b"")
        record, _ = c.get_pack(Pack("N", name="renamed", uses=[Use(CLOSE_EDIT, "ws1", "anna", 7)]))
        self.assertEqual(record, complete_pack("N", name="renamed"))
        # A partial record for a missing pack ends the connection.
        self.assertFailsWithBye(lambda: c.get_pack(Pack("M", uses=[Use(OPEN_FOR_EDIT, "ws1")])))
        self.assertIsNone(self.client(db).get_pack_info("M"))


class UseEntryTest(ServerTest):
    def setUp(self) -> None:
        super().setUp()
        self.c = self.client(self.db())
        self.c.save_pack(complete_pack("P"), b"content")

    def uses(self) -> list[tuple]:
        return [(u.state, u.host, u.user, u.process) for u in self.c.get_pack_info("P").uses]

    def test_editors(self) -> None:
        c = self.c
        before = int(time.time())
        answer = c.update_pack_info(Pack("P", uses=[Use(OPEN_FOR_EDIT, "ws1", "anna", 10)]))
        # The answer carries the use list when the request opened the pack.
        self.assertEqual(answer.id, "P")
        self.assertEqual(answer.status, 1)
        self.assertEqual([(u.state, u.host, u.user, u.process) for u in answer.uses],
                         [(OPEN_FOR_EDIT, "ws1", "anna", 10)])
        self.assertTrue(before - 1 <= answer.uses[0].time <= time.time() + 1, answer.uses[0].time)
        c.update_pack_info(Pack("P", uses=[Use(OPEN_FOR_EDIT, "ws1", "anna", 10)]))
        c.update_pack_info(Pack("P", uses=[Use(OPEN_FOR_EDIT, "ws2", "", 0)]))
        self.assertEqual(self.uses(), [(0, "ws1", "anna", 10), (0, "ws1", "anna", 10), (0, "ws2", "", 0)])

        answer = c.update_pack_info(Pack("P", uses=[Use(CLOSE_EDIT, "ws1", "anna", 10)]))
        self.assertEqual(answer, Pack("P", status=1))
        self.assertEqual(self.uses(), [(0, "ws1", "anna", 10), (0, "ws2", "", 0)])
        c.update_pack_info(Pack("P", uses=[Use(CLOSE_EDIT, "ws1", "anna", 99)]))  # none is no error
        c.update_pack_info(Pack("P", uses=[Use(CLOSE_EDIT, "WS2", "", 0)]))  # host names are case-sensitive
        self.assertEqual(self.uses(), [(0, "ws1", "anna", 10), (0, "ws2", "", 0)])
        c.update_pack_info(Pack("P", uses=[Use(CLOSE_EDIT, "ws1", "anna", 10)]))
        c.update_pack_info(Pack("P", uses=[Use(CLOSE_EDIT, "ws2", "", 0)]))
        self.assertEqual(self.uses(), [])

    def test_only_the_first_entry_counts_and_other_states_change_nothing(self) -> None:
        c = self.c
        c.update_pack_info(Pack("P", uses=[Use(OPEN_FOR_EDIT, "ws1"), Use(LOCK_FOR_UPLOAD, "ws2")]))
        self.assertEqual(self.uses(), [(0, "ws1", "", 0)])
        for state in [1, 3, 99, 102, -1]:
            with self.subTest(state=state):
                c.update_pack_info(Pack("P", name=f"state {state}", uses=[Use(state, "ws3")]))
                self.assertEqual(self.uses(), [(0, "ws1", "", 0)])
                self.assertEqual(c.get_pack_info("P").name, f"state {state}")

    def test_upload_lock(self) -> None:
        db = self.db()
        c = self.c
        answer = c.update_pack_info(Pack("P", uses=[Use(LOCK_FOR_UPLOAD, "scan-1", "", 0)]))
        self.assertEqual([(u.state, u.host) for u in answer.uses], [(LOCK_FOR_UPLOAD, "scan-1")])
        first_time = answer.uses[0].time
        # The same host renews it.
        c.update_pack_info(Pack("P", uses=[Use(LOCK_FOR_UPLOAD, "scan-1", "", 0)]))
        locks = [u for u in c.get_pack_info("P").uses if u.state == LOCK_FOR_UPLOAD]
        self.assertEqual([u.host for u in locks], ["scan-1"])
        self.assertGreaterEqual(locks[0].time, first_time)

        # Another host, even one differing only in case, is refused, and
        # nothing of its request is stored.
        for host in ["scan-2", "SCAN-1"]:
            for label, request in [
                ("UpdatePackInfo", lambda o: o.update_pack_info(Pack("P", name="taken", uses=[Use(LOCK_FOR_UPLOAD, host)]))),
                ("SavePack", lambda o: o.save_pack(Pack("P", name="taken", uses=[Use(LOCK_FOR_UPLOAD, host)]), b"other")),
                ("GetPack", lambda o: o.get_pack(Pack("P", name="taken", uses=[Use(LOCK_FOR_UPLOAD, host)]))),
                ("GetPack unlock", lambda o: o.get_pack(Pack("P", name="taken", uses=[Use(END_UPLOAD, host)]))),
            ]:
                with self.subTest(host=host, request=label):
                    other = self.client(db)
                    self.assertFailsWithBye(lambda: request(other))
                    self.assertEqual(self.c.get_pack("P"), (complete_pack("P", uses=locks), b"content"))

        c.update_pack_info(Pack("P", uses=[Use(END_UPLOAD, "scan-1")]))
        self.assertEqual(self.uses(), [])
        # Released: another host may take it now, and an unlock by a host
        # that does not hold it is refused.
        c.update_pack_info(Pack("P", uses=[Use(LOCK_FOR_UPLOAD, "scan-2")]))
        self.assertEqual(self.uses(), [(LOCK_FOR_UPLOAD, "scan-2", "", 0)])
        self.assertFailsWithBye(lambda: c.update_pack_info(Pack("P", uses=[Use(END_UPLOAD, "scan-1")])))
        self.c = self.client(db)
        self.assertEqual(self.uses(), [(LOCK_FOR_UPLOAD, "scan-2", "", 0)])


# --- Maintenance ---------------------------------------------------------------------


def local_zip_extras(data: bytes) -> dict[str, list[int]]:
    """For each local file header of a ZIP file: the ids of its extra fields."""
    out: dict[str, list[int]] = {}
    pos = 0
    while data.startswith(b"PK\x03\x04", pos):
        (_, _, _, _, _, _, _, compressed, _, name_len, extra_len) = struct.unpack_from("<IHHHHHIIIHH", data, pos)
        name = data[pos + 30 : pos + 30 + name_len].decode("utf-8", "replace")
        extra = data[pos + 30 + name_len : pos + 30 + name_len + extra_len]
        ids = []
        i = 0
        while i + 4 <= len(extra):
            header_id, size = struct.unpack_from("<HH", extra, i)
            ids.append(header_id)
            i += 4 + size
        out[name] = ids
        pos += 30 + name_len + extra_len + compressed
    return out


class BackupTest(ServerTest):
    def test_archive_of_one_database(self) -> None:
        name = self.db()
        c = self.client(name)
        c.set_cfg_part("layout", {"a": 1})
        c.set_data("X", "f1", b"one" * 1000)
        c.set_data("Y", "f2", bytes(range(256)))
        progress = c.backup()
        texts = self.texts(progress)
        self.assertEqual(progress[0], Progress(0, "Starting Database Backup..."))
        self.assertEqual(texts[1], f'Starting backup for "{name}" ...')
        self.assertIn("Metadata backup started...", texts)
        self.assertIn("Metadata backup finished", texts)
        self.assertTrue(all(0 <= p.percent <= 100 for p in progress))
        for prefix, pattern in [("Metadata backup:", r"Metadata backup: (\d+)% completed \((\d+)/(\d+)\)"),
                                ("Compressing metadata", r"Compressing metadata (\d+)% complete \((\d+)/(\d+)\)"),
                                ("Compressing binaries", r"Compressing binaries (\d+)% complete \((\d+)/(\d+)\)")]:
            with self.subTest(prefix):
                lines = [t for t in texts if t.startswith(prefix)]
                self.assertTrue(lines)
                for t in lines:
                    self.assertRegex(t, "^" + pattern + "$")
                percents = [int(re.match(pattern, t).group(1)) for t in lines]
                self.assertEqual(percents, sorted(percents))
                self.assertEqual(percents[-1], 100)
        c.ping()  # the connection goes on

        path = os.path.join(self.server.backup_folder, backup_file_name(database_key(name)))
        with open(path, "rb") as f:
            data = f.read()
        archive = zipfile.ZipFile(io.BytesIO(data))
        self.assertIsNone(archive.testzip())
        self.assertEqual(archive.comment, b"")
        names = archive.namelist()
        self.assertFalse([n for n in names if n.endswith("/") or n.endswith("\\")], "directory entries")
        self.assertTrue(all(i.compress_type == zipfile.ZIP_DEFLATED for i in archive.infolist()))
        self.assertEqual(archive.read("d\\X\\f1"), b"one" * 1000)
        self.assertEqual(archive.read("d\\Y\\f2"), bytes(range(256)))
        origin = archive.read("originDB.txt").split(b"\r\n")
        self.assertEqual(len(origin), 2)
        self.assertEqual(os.path.realpath(origin[0].decode()),
                         os.path.realpath(os.path.join(db_folder(self.server.db_root, name), "cvdb.edb")))
        self.assertEqual(origin[1].decode(), name)
        # The database file is the one entry left.
        self.assertEqual(len([n for n in names if n != "originDB.txt" and not n.startswith("d\\")]), 1)
        for entry, ids in local_zip_extras(data).items():
            with self.subTest(entry=entry):
                self.assertIn(0x0001, ids, "no ZIP64 extra field")
        self.assertEqual(len(local_zip_extras(data)), len(names))

    def test_targets(self) -> None:
        name = self.db()
        c = self.client(name)
        c.set_data("X", "f", b"x")
        folder = self.server.backup_folder
        default = backup_file_name(database_key(name))
        outside = tempfile.mkdtemp(prefix="cvdb-pyclient-target-")
        self.addCleanup(lambda: shutil.rmtree(outside, ignore_errors=True))
        os.makedirs(os.path.join(folder, "sub", "inner"), exist_ok=True)
        cases = [
            ("", os.path.join(folder, default)),
            ("named", os.path.join(folder, "named.cvbak")),
            ("already.cvbak", os.path.join(folder, "already.cvbak")),
            ("upper.CVBAK", os.path.join(folder, "upper.CVBAK.cvbak")),
            ("sub\\file", os.path.join(folder, "sub", "file.cvbak")),
            ("sub/inner/", os.path.join(folder, "sub", "inner", default)),
            ("sub\\inner", os.path.join(folder, "sub", "inner", default)),
            (outside, os.path.join(outside, default)),
            (os.path.join(outside, "abs"), os.path.join(outside, "abs.cvbak")),
        ]
        for target, expected in cases:
            with self.subTest(target=target):
                if os.path.exists(expected):
                    os.remove(expected)
                c.backup(target)
                self.assertTrue(zipfile.is_zipfile(expected), expected)

    def test_target_inside_a_database_folder_is_refused(self) -> None:
        name = self.db()
        c = self.client(name)
        target = os.path.join(db_folder(self.server.db_root, name), "inside.cvbak")
        with self.assertRaises(OperationFailed) as cm:
            c.backup(target)
        self.assertEqual(cm.exception.bye, PROCESSING_ERROR)
        self.assertEqual(cm.exception.progress[-1].percent, 100)
        self.assertFalse(os.path.exists(target))

    def test_every_database(self) -> None:
        c = self.client(self.db())
        self.client(self.db("\\below")).set_data("X", "f", b"x")
        folder = tempfile.mkdtemp(prefix="cvdb-pyclient-all-")
        self.addCleanup(lambda: shutil.rmtree(folder, ignore_errors=True))
        names = c.db_names()
        progress = c.backup(folder, all=True)
        self.assertEqual(progress[0].text, "Starting Database Backup...")
        started = {t for t in self.texts(progress) if t.startswith("Starting backup for")}
        self.assertEqual(started, {f'Starting backup for "{n}" ...' for n in names})
        self.assertEqual(sorted(os.listdir(folder)), sorted(backup_file_name(database_key(n)) for n in names))


class RestoreTest(ServerTest):
    def prepare(self, name: str) -> Client:
        """A database with a configuration part, data and a pack, backed up to its default
        file and changed afterwards."""
        c = self.client(name)
        c.set_cfg_part("k", {"v": "backed up"})
        c.set_data("X", "f", b"backed up")
        c.save_pack(complete_pack("P"), b"backed up")
        c.backup()
        c.set_cfg_part("k", {"v": "changed"})
        c.set_data("X", "f", b"changed")
        c.set_data("Z", "f", b"written after the backup")
        c.erase_pack("P")
        c.save_pack(complete_pack("Q"), b"after")
        return c

    def assertRestored(self, c: Client) -> None:
        self.assertEqual(c.get_cfg_part("k"), {"v": "backed up"})
        self.assertEqual(c.get_data("X", "f"), b"backed up")
        self.assertEqual(c.get_data("Z", "f"), b"")
        self.assertEqual(c.get_pack("P"), (complete_pack("P"), b"backed up"))
        self.assertIsNone(c.get_pack_info("Q"))

    def assertChanged(self, c: Client) -> None:
        self.assertEqual(c.get_cfg_part("k"), {"v": "changed"})
        self.assertEqual(c.get_data("X", "f"), b"changed")
        self.assertEqual(c.get_data("Z", "f"), b"written after the backup")
        self.assertIsNone(c.get_pack_info("P"))

    def test_round_trip(self) -> None:
        c = self.prepare(self.db())
        progress = c.restore()
        texts = self.texts(progress)
        self.assertEqual(progress[0], Progress(0, "Starting Database Restore..."))
        self.assertIn(Progress(0, "Starting decompression ..."), progress)
        self.assertEqual(progress[-1], Progress(100, "Replacing binaries..."))
        order = [texts.index(t) for t in ["Starting decompression ...", "Metadata restore started...",
                                          "Metadata restore finished", "Replacing binaries..."]]
        self.assertEqual(order, sorted(order))
        for t in texts:
            if t.startswith("Decompression ") or t.startswith("Metadata restore:"):
                self.assertRegex(t, r"^(Decompression (\d+)% complete|Metadata restore: (\d+)% completed) \((\d+)/(\d+)\)$")
        decompression = [int(re.match(r"Decompression (\d+)%", t).group(1)) for t in texts if t.startswith("Decompression ")]
        self.assertTrue(decompression)
        self.assertLess(decompression[-1], 100)  # none after the last entry
        # The session is open again, on the restored database.
        self.assertRestored(c)

    def test_archive_of_another_database(self) -> None:
        source, target = self.db("_source"), self.db("_target")
        c = self.client(source)
        c.set_cfg_part("k", {"from": "source"})
        c.set_data("X", "f", b"source data")
        c.backup("copy-" + self.db())
        c.connect(target)
        c.set_cfg_part("k", {"from": "target"})
        c.restore("copy-" + self.db() + ".cvbak")
        # Into the connection's database, whatever the archive records.
        self.assertEqual(c.get_cfg_part("k"), {"from": "source"})
        self.assertEqual(c.get_data("X", "f"), b"source data")
        c.connect(source)
        self.assertEqual(c.get_cfg_part("k"), {"from": "source"})
        self.assertEqual(sorted(n for n in c.db_names() if n.startswith(self.db())), [source, target])

    def test_waits_for_the_other_clients(self) -> None:
        name = self.db()
        c = self.prepare(name)
        other = self.client(name)
        c.send_request(RESTORE, Writer().str("").bool(False).bytes())
        stream = c.read_progress(RESTORE)
        self.assertEqual(next(stream), Progress(0, "Starting Database Restore..."))
        waiting = next(stream)
        self.assertNotEqual(waiting.text, "Starting decompression ...", "the restore did not wait")
        self.assertFalse(waiting.failed, waiting.text)
        other.ping()  # the other client is still served
        self.assertChanged(other)
        other.close()
        rest = list(stream)
        self.assertIn("Starting decompression ...", self.texts(rest))
        self.assertRestored(c)

    def test_missing_archive(self) -> None:
        name = self.db()
        c = self.prepare(name)
        with self.assertRaises(OperationFailed) as cm:
            c.restore("no such archive")
        failure = cm.exception
        path = os.path.join(self.server.backup_folder, "no such archive")
        self.assertEqual(failure.reason, f'Database restore for "{name}" can not find the backup file: "{path}"')
        self.assertEqual(failure.progress[-1].percent, 100)
        self.assertEqual(failure.bye, PROCESSING_ERROR)
        self.assertChanged(self.client(name))

    def test_damaged_and_foreign_archives_leave_the_database_as_it_was(self) -> None:
        name = self.db()
        self.prepare(name).close()
        default = os.path.join(self.server.backup_folder, backup_file_name(database_key(name)))
        with zipfile.ZipFile(default) as real:
            entries = {i.filename: real.read(i) for i in real.infolist()}
        db_entry = next(n for n in entries if n != "originDB.txt" and not n.startswith("d\\"))
        # A database file that is not one of this server's: an empty SQLite database.
        empty_db = os.path.join(self.server.dir, "empty.sqlite")
        sqlite3.connect(empty_db).execute("CREATE TABLE t (x)").connection.close()
        with open(empty_db, "rb") as f:
            entries[db_entry] = f.read()
        foreign = os.path.join(self.server.backup_folder, "foreign.cvbak")
        with zipfile.ZipFile(foreign, "w", zipfile.ZIP_DEFLATED) as z:
            for entry, content in entries.items():
                z.writestr(entry, content)
        damaged = os.path.join(self.server.backup_folder, "damaged.cvbak")
        with open(damaged, "wb") as f:
            f.write(b"PK\x03\x04" + os.urandom(4000))
        with open(default, "rb") as f:
            truncated = f.read()
        truncated_path = os.path.join(self.server.backup_folder, "truncated.cvbak")
        with open(truncated_path, "wb") as f:
            f.write(truncated[: len(truncated) // 2])

        for target in ["foreign.cvbak", "damaged.cvbak", "truncated.cvbak"]:
            with self.subTest(target=target):
                c = self.client(name)
                with self.assertRaises(OperationFailed) as cm:
                    c.restore(target)
                if target == "foreign.cvbak":
                    self.assertEqual(cm.exception.reason, "The backup format is not compatible with the engine version")
                self.assertNotEqual(cm.exception.reason, "Operation timeout!")
                self.assertEqual(cm.exception.bye, PROCESSING_ERROR)
                # Closed before the next restore, which would wait for it.
                with Client("127.0.0.1", self.server.port) as check:
                    check.connect(name)
                    self.assertChanged(check)

    def test_every_archive_of_a_folder(self) -> None:
        names = [self.db("_one"), self.db("\\two")]
        folder = os.path.join(self.server.backup_folder, "restore-all-" + self.db())
        os.makedirs(folder)
        for name in names:
            c = self.client(name)
            c.set_cfg_part("k", {"v": name})
            c.backup(folder + "/")
            c.set_cfg_part("k", {"v": "changed"})
            c.close()
        with open(os.path.join(folder, "notes.txt"), "w") as f:
            f.write("not an archive")
        os.makedirs(os.path.join(folder, "folder.cvbak"))
        self.assertEqual(len(os.listdir(folder)), 4)

        c = self.client(self.db("_restorer"))
        progress = c.restore(folder, all=True)
        self.assertEqual(progress[0].text, "Starting Database Restore...")
        self.assertEqual(self.texts(progress).count("Replacing binaries..."), 2)
        for name in names:
            with self.subTest(name=name):
                self.assertEqual(self.client(name).get_cfg_part("k"), {"v": name})
        c.ping()

    def test_an_archive_that_records_no_database_goes_by_its_file_name(self) -> None:
        source, target = self.db("_source"), self.db("-target\\sub")
        c = self.client(source)
        c.set_cfg_part("k", {"from": "source"})
        c.backup()
        with zipfile.ZipFile(os.path.join(self.server.backup_folder, backup_file_name(database_key(source)))) as real:
            entries = {i.filename: real.read(i) for i in real.infolist() if i.filename != "originDB.txt"}
        folder = os.path.join(self.server.backup_folder, "by-file-name-" + self.db())
        os.makedirs(folder)
        with zipfile.ZipFile(os.path.join(folder, backup_file_name(database_key(target))), "w", zipfile.ZIP_DEFLATED) as z:
            for entry, content in entries.items():
                z.writestr(entry, content)
        with Client("127.0.0.1", self.server.port) as other:  # closed: the restore waits for its clients
            other.connect(target)
            other.set_cfg_part("k", {"from": "target"})
        c.restore(folder, all=True)
        self.assertEqual(self.client(target).get_cfg_part("k"), {"from": "source"})

    def test_an_archive_naming_a_refused_database_fails(self) -> None:
        name = self.db()
        c = self.client(name)
        c.backup()
        with zipfile.ZipFile(os.path.join(self.server.backup_folder, backup_file_name(database_key(name)))) as real:
            entries = {i.filename: real.read(i) for i in real.infolist()}
        first_line = entries["originDB.txt"].split(b"\r\n")[0]
        entries["originDB.txt"] = first_line + b"\r\ndb.temp\\evil"
        folder = os.path.join(self.server.backup_folder, "refused-" + self.db())
        os.makedirs(folder)
        with zipfile.ZipFile(os.path.join(folder, "evil.cvbak"), "w", zipfile.ZIP_DEFLATED) as z:
            for entry, content in entries.items():
                z.writestr(entry, content)
        with self.assertRaises(OperationFailed) as cm:
            c.restore(folder, all=True)
        self.assertIn("evil.cvbak", cm.exception.reason)
        self.assertNotIn("db.temp\\evil", self.client().db_names())


class CleanupTest(ServerTest):
    PATTERN = re.compile(r"^Removing data chunks (\d+)% complete \((\d+)/(\d+)\), (\d+) erased$")

    def test_database_without_data(self) -> None:
        c = self.client(self.db())
        progress = c.cleanup([])
        self.assertEqual(progress, [Progress(0, "Starting Database Cleanup..."), Progress(0, "Erasing unused data..."),
                                    Progress(100, "No data found")])
        c.ping()

    def test_removes_old_unused_entries(self) -> None:
        name = self.db()
        c = self.client(name)
        for id in ["old-a", "old-b", "used", "young"]:
            c.set_data(id, "f", id.encode())
        data_folder = os.path.join(db_folder(self.server.db_root, name), "d")
        outside = tempfile.mkdtemp(prefix="cvdb-pyclient-link-")
        self.addCleanup(lambda: shutil.rmtree(outside, ignore_errors=True))
        with open(os.path.join(outside, "kept"), "w") as f:
            f.write("must survive")
        os.symlink(outside, os.path.join(data_folder, "link"))
        with open(os.path.join(data_folder, "stray"), "w") as f:
            f.write("a plain file")
        seven_hours_ago = time.time() - 7 * 3600
        for entry in ["old-a", "old-b", "used", "stray", "link"]:
            path = os.path.join(data_folder, entry)
            if os.path.isdir(path) and not os.path.islink(path):
                for file in os.listdir(path):
                    os.utime(os.path.join(path, file), (seven_hours_ago, seven_hours_ago))
            os.utime(path, (seven_hours_ago, seven_hours_ago), follow_symlinks=False)

        progress = c.cleanup(["used", "used", "not-there"])
        self.assertEqual(progress[:2], [Progress(0, "Starting Database Cleanup..."), Progress(0, "Erasing unused data...")])
        counts = []
        for p in progress[2:]:
            m = self.PATTERN.match(p.text)
            self.assertTrue(m, p.text)
            counts.append(tuple(int(g) for g in m.groups()))
            self.assertEqual(p.percent, counts[-1][0])
        percents = [n for n, _, _, _ in counts]
        self.assertTrue(all(b - a >= 5 for a, b in zip(percents, percents[1:])), percents)
        self.assertEqual(percents[-1], 100)
        self.assertTrue(all(0 <= n <= 100 for n in percents))
        erased = [e for _, _, _, e in counts]
        self.assertEqual(erased, sorted(erased))
        self.assertLessEqual(erased[-1], 4)

        self.assertEqual(sorted(os.listdir(data_folder)), ["used", "young"])
        self.assertEqual(c.get_data("old-a", "f"), b"")
        self.assertEqual(c.get_data("used", "f"), b"used")
        self.assertEqual(c.get_data("young", "f"), b"young")
        with open(os.path.join(outside, "kept")) as f:
            self.assertEqual(f.read(), "must survive")

    def test_a_write_renews_an_id(self) -> None:
        name = self.db()
        c = self.client(name)
        c.set_data("renewed", "f", b"old")
        c.set_data("copied-into", "f", b"old")
        data_folder = os.path.join(db_folder(self.server.db_root, name), "d")
        seven_hours_ago = time.time() - 7 * 3600
        for id in ["renewed", "copied-into"]:
            os.utime(os.path.join(data_folder, id, "f"), (seven_hours_ago, seven_hours_ago))
            os.utime(os.path.join(data_folder, id), (seven_hours_ago, seven_hours_ago))
        c.set_data("renewed", "g", b"new")
        c.set_data("source", "h", b"new")
        c.change_doc_id("source", "copied-into")
        c.cleanup([])
        self.assertEqual(c.get_data("renewed", "f"), b"old")
        self.assertEqual(c.get_data("copied-into", "f"), b"old")
        self.assertEqual(c.get_data("copied-into", "h"), b"new")


# --- The end of connections -----------------------------------------------------------


class TimeoutTest(ServerTest):
    """The two 30-second limits, run side by side."""

    def test_stalled_frame_and_unread_answers(self) -> None:
        db = self.db()
        self.client(db).set_data("big", "f", os.urandom(1 << 20) * 8)  # 8 MiB
        idle = self.client(db, timeout=120)
        # A small receive buffer and answers the client never reads.
        unread = self.client(db, timeout=120, receive_buffer=4096)
        request = frame(GET_DATA, KIND_REQUEST, Writer().str("big").str("f").bytes())
        unread.send_raw(request * 8)
        stalled = self.client(timeout=120)
        stalled.send_raw(struct.pack("<IBB", 16, PING_PONG, KIND_REQUEST) + b"ab")
        started = time.monotonic()
        self.assertBye(stalled, "Frame incomplete for too long")
        self.assertGreaterEqual(time.monotonic() - started, 25)

        # The unread connection's limit runs from the server's last write to
        # it, which the client cannot see: the server's log tells when it
        # gave up. Reading before then would let it go on writing.
        self.assertTrue(self.server.wait_for_line("has not read its answers", 60),
                        "the server kept a connection that did not read its answers")
        answers = 0
        try:
            while True:
                f = unread.read_frame()
                if f.kind == KIND_BYE:
                    self.assertEqual(unread.bye, "Answers not read for too long")
                    break
                self.assertEqual((f.tag, f.kind), (GET_DATA, KIND_ANSWER))
                answers += 1
        except (ConnectionClosed, ConnectionResetError):
            pass
        self.assertLess(answers, 8, "the server kept the unread connection")

        # A connection idle between frames stays open.
        idle.ping()


class ServerStopTest(unittest.TestCase):
    def test_clients_are_told_the_server_stops(self) -> None:
        own = ServerProcess(SERVER_BINARY)
        self.addCleanup(own.remove)
        self.addCleanup(own.stop, signal.SIGKILL)  # when the test fails before it stops the server
        idle = Client("127.0.0.1", own.port)
        self.addCleanup(idle.close)
        bound = Client("127.0.0.1", own.port)
        self.addCleanup(bound.close)
        bound.connect("stopping")
        bound.ping()
        own.process.send_signal(signal.SIGTERM)
        for c in [idle, bound]:
            self.assertEqual(c.expect_bye(), "Server is stopping")
        self.assertEqual(own.stop(), 0)


def main() -> None:
    global SERVER_BINARY
    args = sys.argv[1:]
    if args and not args[0].startswith("-"):
        SERVER_BINARY = args.pop(0)
    unittest.main(argv=[sys.argv[0]] + args, verbosity=2)


if __name__ == "__main__":
    main()
