"""A certificate authority of the lab's own, and what it signs."""

from __future__ import annotations

from dataclasses import dataclass
from pathlib import Path

from lab.clock import at
from lab.support import run_tool

_DAYS = 3650


@dataclass(frozen=True)
class KeyPair:
    """PEM files of a certificate and its private key."""

    certificate: Path
    key: Path


class Authority:
    """Signs server certificates; a host trusts it when its certificate is the host's bundle."""

    def __init__(self, folder: Path, name: str = "Lab Authority") -> None:
        self._folder = folder
        folder.mkdir(parents=True, exist_ok=True)
        self._own = KeyPair(folder / "ca.crt", folder / "ca.key")
        _make(self._own, name, ["keyUsage=critical,keyCertSign,cRLSign"])

    @property
    def certificate(self) -> Path:
        """What a client must trust."""
        return self._own.certificate

    def sign(self, host_name: str, expired: bool = False) -> KeyPair:
        """Make a server certificate for one name; `expired` makes it one that ran out a day ago."""
        pair = KeyPair(self._folder / f"{host_name}.crt", self._folder / f"{host_name}.key")
        _make(pair, host_name,
              [f"subjectAltName=DNS:{host_name}", "extendedKeyUsage=serverAuth",
               "basicConstraints=critical,CA:FALSE", "keyUsage=digitalSignature"], self._own,
              -(_DAYS + 1) * 24 * 3600 if expired else 0)
        return pair


def _make(pair: KeyPair, name: str, extensions: list[str], signer: KeyPair | None = None,
          ahead: int = 0) -> None:
    """Make a key and its certificate, self-signed without a signer, `ahead` seconds from now."""
    signing = ["-CA", str(signer.certificate), "-CAkey", str(signer.key)] if signer else []
    run_tool("env", *(at(ahead) if ahead else ()), "openssl", "req", "-x509", "-newkey", "ec",
             "-pkeyopt", "ec_paramgen_curve:P-256", "-noenc", "-days", str(_DAYS),
             "-subj", f"/CN={name}", "-keyout", str(pair.key),
             "-out", str(pair.certificate), *signing,
             *(word for extension in extensions for word in ("-addext", extension)))
