"""The device's identity, shared by the device, the central service and the relay."""

from __future__ import annotations

from dataclasses import dataclass

SERVICE_HOST = "cloud.kavra.example"
DOMAIN = ".kavra.example"


@dataclass(frozen=True)
class Account:
    """A device as shipped; identifier, authorisation and subdomain are secret."""

    device_id: str = "4711830295"
    auth: str = "b7Qk2xN9wTz4"
    subdomain: str = f"q8z5hash31{DOMAIN}"
    host_name: str = "mynas"

    @property
    def secrets(self) -> tuple[str, str, str]:
        """What must never appear in a log."""
        return self.device_id, self.auth, self.subdomain

    @property
    def names(self) -> tuple[str, str, str]:
        """The device's public names: under its own label, joined to it, and hashed."""
        label = f"device{self.device_id}{DOMAIN}"
        return f"{self.host_name}.{label}", f"{self.host_name}-{label}", self.subdomain
