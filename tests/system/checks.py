"""What the system tests look at again and again."""

from __future__ import annotations

from lab import daemon, network
from lab.central import PORT_FORWARD, Record
from lab.device import DYNAMIC_COPY
from lab.gateway import Mapping
from lab.scenario import Lab

OPTIONS = ("-l", "7", "-f", "30")
LOCAL0 = 16

BOTH_MAPPED = [Mapping("TCP", 9091, network.DEVICE_ADDRESS, 80),
               Mapping("TCP", 9444, network.DEVICE_ADDRESS, 443)]
PUBLISHED = Record(network.GATEWAY_WAN_ADDRESS, network.DEVICE_ADDRESS, 9091, 9444)


def wait_for_status(lab: Lab, status: str, seconds: float) -> None:
    """Wait until the device's own configuration holds the status."""
    lab.wait_for(lambda: lab.device.status == status, f"status {status}", seconds)


def wait_for_log(lab: Lab, part: str, seconds: float, count: int = 1) -> None:
    """Wait until the device's log has held a text this often."""
    lab.wait_for(lambda: lab.device.messages.count(part) >= count, f"{count} x [{part}]", seconds)


def wait_for_next_cycle(lab: Lab, seconds: float) -> None:
    """Wait until one more cycle has run to its pause."""
    pause = "DaemonControl::run - retry connection after 120 secs."
    wait_for_log(lab, pause, seconds, lab.device.messages.count(pause) + 1)


def assert_published(lab: Lab) -> None:
    """Both ports are open at the gateway, and everybody knows them."""
    assert lab.gateway.mappings() == BOTH_MAPPED
    assert lab.central.record == PUBLISHED
    assert lab.device.setting("EXTERNAL_HTTP_PORT") == "9091"
    assert lab.device.setting("EXTERNAL_HTTPS_PORT") == "9444"
    assert lab.device.setting("EXTERNAL_IP") == network.GATEWAY_WAN_ADDRESS
    assert "COMMUNICATION_STATUS=portforwarded\n" in DYNAMIC_COPY.read_text(errors="replace")
    assert [lab.names.resolve(name) for name in lab.account.names] == [
        network.GATEWAY_WAN_ADDRESS] * 3


def assert_stops_clean(lab: Lab) -> None:
    """SIGTERM ends the daemon by that signal and takes everything down that it put up."""
    withdrawals = lab.central.withdrawals
    assert lab.stop_daemon() == "SIGTERM"
    assert lab.gateway.mappings() == []
    assert lab.central.record is None
    assert lab.central.withdrawals == withdrawals + 1
    assert lab.central.requests_for(PORT_FORWARD)[-1].argument("external_ip") == "NULL"
    assert lab.device.status == "disabled"
    assert lab.device.setting("EXTERNAL_HTTP_PORT") == "0"
    assert daemon.running("pelorus") == []
    assert_log_is_proper(lab)


def assert_log_is_proper(lab: Lab) -> None:
    """Every line is the daemon's and tells no secret."""
    assert {(message.ident, message.facility) for message in lab.device.messages.all} == {
        ("Pelorus", LOCAL0)}
    lines = lab.device.messages.texts()
    for secret in lab.account.secrets:
        assert not [line for line in lines if secret in line]
