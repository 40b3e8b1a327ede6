"""The Python package against the real daemons: a Python host and Python plug-ins, the JSON
mapping, and errors as exceptions."""

from __future__ import annotations

import datetime
import math
import os
import uuid

import pytest

import annexa
from annexa import _json

UUID = uuid.UUID("01234567-89ab-cdef-0123-456789abcdef")
WHEN = datetime.datetime(2026, 11, 22, 10, 0, 0, 250000, tzinfo=datetime.timezone.utc)


@pytest.mark.parametrize("value, text", [
    (None, "null"),
    (True, "true"),
    (-5, "-5"),
    (2**53, "9007199254740992"),
    (2**53 + 1, '{"$int64":"9007199254740993"}'),
    (-(2**63), '{"$int64":"-9223372036854775808"}'),
    (2**64 - 1, '{"$uint64":"18446744073709551615"}'),
    (2.0, "2.0"),
    (float("-inf"), '{"$double":"-inf"}'),
    ("é \" $uuid", '"é \\" $uuid"'),
    (b"\x0a\x1b\xff\x00", '{"$data":"Chv/AA=="}'),
    (WHEN, '{"$date":"2026-11-22T10:00:00.25Z"}'),
    (UUID, '{"$uuid":"01234567-89AB-CDEF-0123-456789ABCDEF"}'),
    (annexa.Descriptor(3), '{"$fd":3}'),
    ({"$uuid": "not one"}, '{"$dictionary":{"$uuid":"not one"}}'),
    ({"$uuid": 1, "b": [UUID]}, '{"$uuid":1,"b":[{"$uuid":"01234567-89AB-CDEF-0123-456789ABCDEF"}]}'),
])
def test_the_json_mapping_round_trips_every_kind(value, text):
    assert _json.dumps(value) == text
    back = _json.loads(text)
    assert back == value and type(back) is type(value)


def test_the_json_mapping_refuses_what_it_cannot_say():
    nan = _json.loads(_json.dumps(float("nan")))
    assert math.isnan(nan)
    for bad in [2**64, -(2**63) - 1, datetime.datetime(2026, 1, 1), {1: "x"}, object()]:
        with pytest.raises((TypeError, ValueError)):
            _json.dumps(bad)
    for bad in ['{"$uid":"x"}', '{"$uuid":5}', '{"$data":"!!"}', '{"$date":"2026-11-22"}',
                '{"$double":"NaN"}', '{"$uint64":"-1"}', '{"$fd":-1}', '{"$dictionary":1}']:
        with pytest.raises(ValueError):
            _json.loads(bad)


def test_a_python_host_finds_readies_and_talks_to_python_plugins(platform):
    app = platform.application("Greeters", ["Hello", "Bye"])
    with annexa.Client() as client:
        found = client.match({"KSExtensionPointName": "Greeting"})
        assert sorted(p.identifier for p in found) == ["com.example.greeters.bye", "com.example.greeters.hello"]
        hello = next(p for p in found if p.identifier.endswith("hello"))
        assert isinstance(hello.uuid, uuid.UUID)
        assert hello.version == "1.0" and hello.path == str(app / "PlugIns" / "Hello.appex")
        assert hello.attributes["Language"] == "en"
        assert hello.bundle_identifier == "com.example.greeters.hello"

        client.ready([hello])
        tokens = client.access([hello])
        assert len(tokens) == 1 and tokens[0].startswith("com.corvane.sandbox.read-only;")
        with hello.connect() as connection:
            # Every kind crosses both ways through the plug-in's own copy of the mapping.
            message = {"uuid": UUID, "data": b"\x00\x01", "when": WHEN, "big": 2**64 - 1, "$odd": {"$x": 1}}
            reply = connection.send(message)
            assert reply["echo"] == message
            assert reply["pid"] != os.getpid()
            assert connection.send({"do": "fail"}) == {"error": "RuntimeError: asked to fail"}
            assert connection.send("plain")["echo"] == "plain"
        with pytest.raises(annexa.Unreachable):
            connection.send({})


def test_annotations_holds_and_the_watch(platform):
    app = platform.application("Watched", ["One"])
    with annexa.Client() as client, client.watch() as watch:
        (one,) = client.match({"KSExtensionIdentifier": "com.example.watched.one"})
        client.annotate([one], election=1, extension={"colour": "blue"})
        # The registry tells axd of the installation on a thread of its own, so the application's
        # "installed" may still come first.
        while (event := watch.next(timeout=5)) is not None and event["event"] == "installed":
            assert event["plugin"]["uuid"] == one.uuid
        assert event is not None and event["event"] == "annotation"
        (again,) = client.match({"KSExtensionIdentifier": "com.example.watched.one"})
        assert again.annotations == {"election": 1, "extension": {"colour": "blue"}}

        with client.lock([str(app)]) as hold:
            assert isinstance(hold.token, uuid.UUID)
            with pytest.raises(annexa.Refused) as refused:
                client.ready([one])
            assert refused.value.code == annexa.ErrorCode.NOT_ENTITLED
            assert "on hold" in refused.value.text
        client.ready([one])
        kinds = set()
        while (event := watch.next(timeout=1)) is not None:
            kinds.add(event["event"])
        assert {"hold", "release"} <= kinds, kinds


def test_errors_are_exceptions_with_the_protocols_code(platform):
    with annexa.Client() as client:
        cases = [
            (lambda: client.ready([uuid.uuid4()]), annexa.Error, 4),
            (lambda: client.add(["relative/App.app"]), annexa.NotFound, 9),
            (lambda: client.remove([str(platform.root / "Nothing.app")]), annexa.Refused, 11),
            (lambda: client.ready(["not-a-uuid"]), annexa.InvalidArgument, -1),
            (lambda: annexa.Client("com.nobody.here").match(), annexa.Unreachable, -2),
            (lambda: annexa.Connection("com.example.unregistered"), annexa.Unreachable, -2),
            (lambda: annexa.plugin.run(lambda message: message), annexa.InvalidArgument, -1),
        ]
        for call, kind, code in cases:
            with pytest.raises(kind) as raised:
                call()
            if code is not None:
                assert raised.value.code == code, raised.value
            assert str(raised.value).endswith(f"(error {raised.value.code})")
        assert client.send({"request": "bulk", "version": 3}) == {}
        assert client.send({"request": "nonsense", "version": 3})["errorcode"] == 4
