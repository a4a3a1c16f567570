"""Input that is not what it should be: the daemon stays alive and works once it is."""

from __future__ import annotations

import random

import pytest
from checks import (OPTIONS, assert_published, assert_stops_clean, wait_for_log,
                    wait_for_next_cycle, wait_for_status)

from lab.account import SERVICE_HOST
from lab.central import PORT_FORWARD, PORT_TEST, WAIT, Fault
from lab.device import DYNAMIC_COPY, DYNAMIC_FILE
from lab.scenario import Lab, Situation

UPNP = Situation(clock=20)
# A tunnel that never starts is given up at the first look instead of after five minutes.
NO_TUNNEL = Situation(clock=20, static={"STARTCMD": "true"})
RUBBISH = random.Random(9091).randbytes(60000)


def test_rubbish_in_the_dynamic_configuration_idles_until_it_is_mended(play):
    lab = play(UPNP)
    proper = DYNAMIC_FILE.read_bytes()
    DYNAMIC_FILE.write_bytes(RUBBISH)
    lab.start_daemon(*OPTIONS)
    wait_for_log(lab, "Deviceid and DeviceAuth is empty. Idle Process.", 30, count=2)
    assert lab.central.requests == []
    assert lab.gateway.mappings() == []
    for path in (DYNAMIC_FILE, DYNAMIC_COPY):
        path.write_bytes(proper)
    wait_for_status(lab, "portforwarded", 40)
    assert_published(lab)
    assert_stops_clean(lab)


def test_rubbish_amid_the_settings_while_running_changes_nothing(play):
    lab = play(UPNP)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "portforwarded", 30)
    proper = DYNAMIC_COPY.read_bytes()
    reloads = lab.device.messages.count("Reload dynamicconfig.ini file.")
    DYNAMIC_COPY.write_bytes(RUBBISH + b"\n" + proper)
    wait_for_log(lab, "Reload dynamicconfig.ini file.", 30, count=reloads + 1)
    wait_for_log(lab, "DNS matches local value", 30)
    assert_published(lab)
    DYNAMIC_COPY.write_bytes(proper)
    assert_stops_clean(lab)


def answer_rubbish(lab: Lab) -> None:
    """More than a device takes, full of what a careless printf would follow; or nothing."""
    lab.central.misbehave(PORT_TEST, Fault(body="%s%n" * 5000))
    lab.central.misbehave(WAIT, Fault(body="<action>wait</action><wait_time>%n%s"))
    lab.central.misbehave(PORT_FORWARD, Fault(body=""))


def answer_sense(lab: Lab) -> None:
    for operation in (PORT_TEST, WAIT, PORT_FORWARD):
        lab.central.misbehave(operation, None)


HARDSHIPS = {
    "answers-rubbish": (answer_rubbish, answer_sense),
    "hangs-up": (lambda lab: lab.central.misbehave(PORT_TEST, Fault(drop=True)), answer_sense),
    "is-not-who-it-says": (lambda lab: lab.central.show_certificate_of("elsewhere.example"),
                           lambda lab: lab.central.show_certificate_of(SERVICE_HOST)),
    "is-gone": (lambda lab: lab.central.stop(), lambda lab: lab.central.start()),
}


@pytest.mark.parametrize("hardship", HARDSHIPS)
def test_device_fails_while_the_service(play, hardship):
    """Without a proof from outside nothing is published; with the service back, everything is."""
    spoil, mend = HARDSHIPS[hardship]
    lab = play(NO_TUNNEL)
    spoil(lab)
    lab.start_daemon(*OPTIONS)
    wait_for_status(lab, "failed", 40)
    wait_for_next_cycle(lab, 40)
    assert lab.central.record is None
    assert lab.gateway.mappings() == []
    mend(lab)
    wait_for_status(lab, "portforwarded", 60)
    assert_published(lab)
    assert_stops_clean(lab)
