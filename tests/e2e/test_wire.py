"""Messages that no proper client sends, and clients that behave badly: never a stall for others."""

import socket
import time

import pytest

from orv_e2e import clients, wire
from orv_e2e.config_file import record
from orv_e2e.programs import DEADLINE

MESSAGE_LIMIT = 65536


@pytest.fixture(scope="module", name="server")
def server_fixture(module_instance):
    module_instance.config.set(clients.BASE, "orv-slapdMaxMessageSize", str(MESSAGE_LIMIT))
    return module_instance.start()


@pytest.fixture(name="bad")
def bad_fixture(server):
    """The connection that misbehaves, bound as the primary administrator."""
    with wire.bound(server) as connection:
        yield connection


@pytest.fixture(name="good")
def good_fixture(server):
    """A connection of somebody else, who has to be served whatever the other does."""
    with wire.bound(server) as connection:
        yield connection
        assert connection.search(9999) == (0, 1), "somebody else is not served any more"


def assert_notice_and_close(connection):
    answers = connection.answers_until_closed()
    assert [answer.is_notice for answer in answers] == [True], answers
    assert answers[0].code == 2


SEARCH = wire.search_request(2)


@pytest.mark.parametrize("count", [1, 2, 3, 5, 10, len(SEARCH) // 2, len(SEARCH) - 1])
def test_message_that_ends_early_closes_the_connection(bad, good, count):
    bad.send(SEARCH[:count])
    assert good.search(2) == (0, 1)
    bad.shut_down_writing()
    assert [answer for answer in bad.answers_until_closed() if not answer.is_notice] == []


def test_client_that_leaves_in_the_middle_of_a_message_harms_nobody(server, good):
    for count in range(1, len(SEARCH)):
        with wire.Wire(server) as leaving:
            leaving.send(SEARCH[:count])
    assert good.search(2) == (0, 1)


def test_client_that_leaves_without_reading_its_answers_harms_nobody(server, good):
    for _ in range(20):
        leaving = wire.Wire(server)
        leaving.send(wire.bind_request(1, "cn=root", server.password))
        leaving.send(b"".join(wire.search_request(i, scope=2, attributes=()) for i in range(2, 30)))
        leaving.socket.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, b"\1\0\0\0\0\0\0\0")
        leaving.close()
    assert good.search(2) == (0, 1)


def test_message_beyond_the_limit_is_met_with_a_notice_before_it_is_read(bad, good):
    bad.send(b"\x30\x84\x7f\xff\xff\xff")
    assert_notice_and_close(bad)
    assert good.search(2) == (0, 1)


def test_message_just_beyond_the_limit_is_met_with_a_notice(bad, good):
    bad.send(b"\x30" + wire.length(MESSAGE_LIMIT))
    assert_notice_and_close(bad)
    assert good.search(2) == (0, 1)


def test_message_of_just_the_limit_is_served(bad):
    def request(padding):
        return wire.search_request(2, attributes=("cn", "x" * padding))
    padding = MESSAGE_LIMIT - len(request(MESSAGE_LIMIT - 1000)) + MESSAGE_LIMIT - 1000
    assert len(request(padding)) == MESSAGE_LIMIT
    bad.send(request(padding))
    assert bad.search_result(2) == (0, 1)


@pytest.mark.parametrize("start", [
    b"\x31\x03\x02\x01\x01", b"\x00\x00", b"GET / HTTP/1.1\r\n\r\n", b"\x16\x03\x01\x02\x00\x01",
    b"\x30\x80\x02\x01\x01\x00\x00", b"\x30\x89" + b"\x01" * 9, b"\xff" * 64, b"\x30\x00",
    b"\x30\x03\x02\x01\x01", b"\x30\x05\x04\x03abc", b"\x30\x84\x00\x00\x00\x00"],
    ids=["another tag", "zeros", "HTTP", "TLS", "indefinite length", "length of nine bytes",
         "ones", "empty", "number alone", "no number", "empty in the long form"])
def test_bytes_that_are_no_message_are_met_with_a_notice(bad, good, start):
    bad.send(start)
    assert_notice_and_close(bad)
    assert good.search(2) == (0, 1)


@pytest.mark.parametrize("tag", [0x40, 0x41, 0x43, 0x61, 0x65, 0x75, 0x7E, 0x80, 0xA0, 0x04, 0x30])
def test_unknown_operation_is_met_with_a_notice(bad, good, tag):
    bad.send(wire.message(2, wire.tlv(tag, b"")))
    assert_notice_and_close(bad)
    assert good.search(2) == (0, 1)


@pytest.mark.parametrize("number", [b"\x02\x01\x00", b"\x02\x01\xff", b"\x02\x05\x01\x00\x00\x00\x00",
                                    b"\x02\x04\x80\x00\x00\x00", b"\x02\x00"],
                         ids=["zero", "negative", "too large", "least", "empty"])
def test_message_number_out_of_range_is_met_with_a_notice(bad, good, number):
    operation = wire.split(SEARCH)[1][3:]
    bad.send(wire.tlv(0x30, number + operation))
    assert_notice_and_close(bad)
    assert good.search(2) == (0, 1)


def assert_refused(connection, number, codes):
    """Either an answer with one of `codes`, or a notice and the end."""
    answer = connection.answer()
    assert answer is not None
    if answer.is_notice:
        assert connection.answers_until_closed() == []
    else:
        assert (answer.message_id, answer.tag) == (number, wire.SEARCH_DONE)
        assert answer.code in codes


def nested(depth, wrap):
    inner = wire.present("objectClass")
    for _ in range(depth):
        inner = wrap(inner)
    return inner


@pytest.mark.parametrize("wrap", [wire.negated, wire.all_of, wire.any_of],
                         ids=["not", "and", "or"])
@pytest.mark.parametrize("depth", [64, 1000, 8000])
def test_filter_that_is_nested_too_deeply_is_refused(bad, good, wrap, depth):
    bad.send(wire.search_request(2, search_filter=nested(depth, wrap)))
    assert_refused(bad, 2, (2, 11, 53))
    assert good.search(2) == (0, 1)


@pytest.mark.parametrize("wrap", [wire.negated, wire.all_of, wire.any_of],
                         ids=["not", "and", "or"])
def test_filter_nested_thirty_times_is_served(bad, wrap):
    assert bad.search(2, search_filter=nested(30, wrap)) == (0, 1)


@pytest.mark.parametrize("content", [
    b"\xa3\x00", b"\xa2\x00", b"\xa4\x04\x04\x02cn", b"\xa4\x06\x04\x02cn\x30\x00", b"\xaa\x00",
    b"\x87\x00", b"\xa9\x00", b"\xa9\x04\x83\x02ab\xff", b"\xa3\x08\x04\x02cn\x04\x7fab",
    b"\xa4\x0c\x04\x02cn\x30\x06\x82\x01a\x80\x01b"],
    ids=["empty assertion", "empty not", "substring without pieces", "substring of none",
         "unknown choice", "presence of nothing", "empty extensible", "trailing byte",
         "value beyond the end", "initial piece last"])
def test_filter_that_cannot_be_read_is_refused(bad, good, content):
    bad.send(wire.search_request(2, search_filter=content))
    assert_refused(bad, 2, (2,))
    assert good.search(2) == (0, 1)


@pytest.mark.parametrize("value", [b"a\0b", b"*", b"(", b")", b"\\", b"\\2a", b"\xff\xfe", b"",
                                   b"a" * 20000, b")(objectClass=*", b"\\zz", b"\x80"])
def test_value_of_a_filter_means_itself(bad, value):
    assert bad.search(2, search_filter=wire.equal("cn", value)) == (0, 0)
    assert bad.search(3) == (0, 1)


@pytest.mark.parametrize("name", [b"", b"cn)(objectClass=*", b"c n", b"cn;", b"*", b"1.", b"\xff",
                                  b"cn\0"])
def test_name_that_is_none_does_not_change_the_filter(bad, name):
    bad.send(wire.search_request(2, search_filter=wire.equal(name, b"configuration")))
    answer = bad.answer()
    assert answer is not None
    if not answer.is_notice:
        assert answer.tag == wire.SEARCH_DONE
        assert bad.search(3) == (0, 1)


@pytest.mark.parametrize("scope", [3, 4, 127, 255])
def test_unknown_scope_is_refused(bad, good, scope):
    bad.send(wire.search_request(2, scope=scope))
    assert_refused(bad, 2, (2,))
    assert good.search(2) == (0, 1)


def test_every_cut_and_every_flipped_byte_of_a_search_leaves_others_served(server, good):
    """Each damaged copy of a message gets an answer or a closed connection."""
    whole = wire.search_request(2, search_filter=wire.all_of(
        wire.present("cn"), wire.negated(wire.equal("cn", "x"))), attributes=("cn", "*"))
    for position in range(len(whole)):
        for flip in (0x01, 0x80, 0xFF):
            with wire.Wire(server) as hurt:
                hurt.send(whole[:position] + bytes([whole[position] ^ flip])
                          + whole[position + 1:])
                hurt.shut_down_writing()
                hurt.answers_until_closed()
    assert good.search(2) == (0, 1)


def test_message_sent_a_byte_at_a_time_is_served_and_so_are_others(bad, good):
    for number, position in enumerate(range(len(SEARCH)), start=2):
        bad.send(SEARCH[position:position + 1])
        assert good.search(number) == (0, 1)
    assert bad.search_result(2) == (0, 1)


def test_hundred_searches_sent_at_once_are_all_answered_in_turn(bad):
    numbers = range(2, 102)
    bad.send(b"".join(wire.search_request(number) for number in numbers))
    for number in numbers:
        assert bad.search_result(number) == (0, 1)


def test_searches_that_straddle_packets_are_all_answered(bad):
    stream = b"".join(wire.search_request(number) for number in range(2, 52))
    for start in range(0, len(stream), 13):
        bad.send(stream[start:start + 13])
    for number in range(2, 52):
        assert bad.search_result(number) == (0, 1)


def test_unbind_closes_without_an_answer(bad):
    bad.send(wire.unbind_request(2))
    assert bad.answers_until_closed() == []


def test_what_follows_an_unbind_is_not_answered(bad):
    bad.send(wire.unbind_request(2) + wire.search_request(3))
    assert bad.answers_until_closed() == []


def test_searches_before_an_unbind_in_the_same_packet_harm_nobody(bad, good):
    bad.send(wire.search_request(2) + wire.unbind_request(3))
    assert {answer.message_id for answer in bad.answers_until_closed()} <= {2}
    assert good.search(2) == (0, 1)


def test_half_closed_connection_still_gets_its_answers(bad):
    bad.send(wire.search_request(2) + wire.search_request(3))
    bad.shut_down_writing()
    assert bad.search_result(2) == (0, 1)
    assert bad.search_result(3) == (0, 1)
    assert bad.answer() is None


def test_three_hundred_connections_are_served_side_by_side(server):
    connections = [wire.Wire(server) for _ in range(300)]
    try:
        for connection in connections:
            connection.send(wire.bind_request(1, "cn=root", server.password))
        for connection in connections:
            answer = connection.answer()
            assert (answer.tag, answer.code) == (wire.BIND_RESPONSE, 0)
        for connection in connections:
            connection.send(wire.search_request(2))
        for connection in connections:
            assert connection.search_result(2) == (0, 1)
    finally:
        for connection in connections:
            connection.close()


# Limits with settings of their own.

def limited(instance, **settings):
    for name, value in settings.items():
        instance.config.set(clients.BASE, "orv-slapd" + name, str(value))
    return instance.start()


def add_large_entries(instance, count=200, size=100000):
    entries = [record("cn=e%d,cn=schemas,cn=configuration" % i,
                      [("objectClass", ["top", "container"]), ("cn", "e%d" % i),
                       ("description", "x" * size)]) for i in range(count)]
    instance.config.append(b"\n".join(entries))
    return count


def test_slow_reader_does_not_stall_others_and_gets_everything(instance):
    count = add_large_entries(instance)
    instance.start()
    with wire.bound(instance, receive_buffer=4096) as slow, wire.bound(instance) as other:
        slow.send(wire.search_request(2, "cn=schemas,cn=configuration", scope=1, attributes=(),
                                      search_filter=wire.present("description")))
        for number in range(2, 22):
            assert other.search(number) == (0, 1)
        assert slow.search_result(2) == (0, count)


def test_reader_that_makes_no_progress_is_dropped(instance):
    add_large_entries(instance)
    limited(instance, WriteTimeOut=1)
    with wire.bound(instance, receive_buffer=4096) as stuck, wire.bound(instance) as other:
        stuck.send(wire.search_request(2, "cn=schemas,cn=configuration", scope=1, attributes=()))
        stuck.socket.setblocking(True)
        limit = time.monotonic() + DEADLINE
        number = 2
        while not was_reset(stuck):
            assert time.monotonic() < limit, "the connection was kept"
            assert other.search(number) == (0, 1)
            number += 1


def was_reset(connection):
    """Whether the peer is gone, seen without reading: a write meets a reset in the end."""
    try:
        connection.socket.send(wire.abandon_request(3, 77), socket.MSG_DONTWAIT)
        return False
    except BlockingIOError:
        return False
    except (BrokenPipeError, ConnectionResetError):
        return True


def test_answer_beyond_its_budget_ends_with_11(instance):
    add_large_entries(instance, 20)
    limited(instance, MaxResultSize=1000000)
    with wire.bound(instance) as connection:
        connection.send(wire.search_request(2, scope=2, attributes=()))
        code, entries = connection.search_result(2)
        assert code == 11
        assert entries > 0
        assert connection.search(3) == (0, 1)


def test_idle_connection_is_closed(instance):
    limited(instance, IdleTimeOut=1)
    with wire.bound(instance) as idle:
        assert all(answer.is_notice for answer in idle.answers_until_closed())


def test_connection_that_never_says_anything_is_closed(instance):
    limited(instance, IdleTimeOut=1)
    with wire.Wire(instance) as silent:
        assert all(answer.is_notice for answer in silent.answers_until_closed())


def test_sender_that_does_not_finish_its_message_is_closed(instance):
    limited(instance, MessageTimeOut=1)
    with wire.bound(instance) as slow:
        slow.send(SEARCH[:10])
        assert all(answer.is_notice for answer in slow.answers_until_closed())


def test_connections_beyond_the_number_for_one_address_are_closed(instance):
    limited(instance, MaxConnectionsPerAddress=5)
    kept = [wire.bound(instance) for _ in range(5)]
    with wire.Wire(instance) as surplus:
        assert all(answer.is_notice for answer in surplus.answers_until_closed())
    assert kept[0].search(2) == (0, 1)
    for connection in kept:
        connection.close()


def test_place_of_a_closed_connection_is_free_again(instance):
    limited(instance, MaxConnections=3)
    for _ in range(20):
        wire.bound(instance).close()
    limit = time.monotonic() + DEADLINE
    while True:
        with wire.Wire(instance) as connection:
            connection.send(wire.bind_request(1, "cn=root", instance.password))
            answer = connection.answer()
            if answer is not None and not answer.is_notice:
                assert answer.code == 0
                return
        assert time.monotonic() < limit, "no place became free"


def test_controls_beyond_their_number_are_refused(instance):
    limited(instance, MaxControls=4)
    with wire.bound(instance) as connection:
        operation = wire.split(wire.search_request(2))[1]
        control = wire.tlv(0x30, wire.octets("1.2.3"))
        connection.send(wire.tlv(0x30, operation + wire.tlv(0xA0, control * 5)))
        assert_refused(connection, 2, (2, 11, 53))
    with wire.bound(instance) as connection:
        connection.send(wire.tlv(0x30, operation + wire.tlv(0xA0, control * 4)))
        assert connection.search_result(2) == (0, 1)
