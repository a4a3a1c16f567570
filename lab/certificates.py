"""A certificate authority of the lab's own, and what it signs."""

from __future__ import annotations

from dataclasses import dataclass
from pathlib import Path

from lab.support import run_tool


@dataclass(frozen=True)
class KeyPair:
    """PEM files of a certificate and its private key."""

    certificate: Path
    key: Path


def _new_key(*arguments: str) -> tuple[str, ...]:
    return ("req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-noenc",
            "-days", "3650", *arguments)


class Authority:
    """Signs server certificates; hosts trust it where its certificate is their bundle."""

    def __init__(self, folder: Path, name: str = "Lab Authority") -> None:
        self._folder = folder
        folder.mkdir(parents=True, exist_ok=True)
        self._own = KeyPair(folder / "ca.crt", folder / "ca.key")
        run_tool("openssl", *_new_key("-subj", f"/CN={name}", "-keyout", str(self._own.key),
                           "-out", str(self._own.certificate),
                           "-addext", "keyUsage=critical,keyCertSign,cRLSign"))

    @property
    def certificate(self) -> Path:
        """What a client must trust."""
        return self._own.certificate

    def sign(self, host_name: str) -> KeyPair:
        """A server certificate for one name."""
        pair = KeyPair(self._folder / f"{host_name}.crt", self._folder / f"{host_name}.key")
        run_tool("openssl", *_new_key("-subj", f"/CN={host_name}", "-keyout", str(pair.key),
                           "-out", str(pair.certificate), "-CA", str(self._own.certificate),
                           "-CAkey", str(self._own.key),
                           "-addext", f"subjectAltName=DNS:{host_name}",
                           "-addext", "extendedKeyUsage=serverAuth",
                           "-addext", "basicConstraints=critical,CA:FALSE",
                           "-addext", "keyUsage=digitalSignature"))
        return pair
