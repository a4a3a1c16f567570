"""A drawing that a web page can show: SVG without script, style or link."""

from __future__ import annotations

import re
import xml.etree.ElementTree as ElementTree

LETTER = 8  # mean width of a letter of 14 pixels in the widest of the usual fonts
WIDTH = 1200

ACTOR_COLOURS = {"device": "#34495e", "router": "#34495e", "gateway": "#8a5a12",
                 "neighbour": "#9b2c2c", "provider": "#4a5568", "central": "#1f6f78",
                 "names": "#3f6b1f", "relay": "#2b6cb0"}
OTHER, INK, QUIET, PALE = "#4a5568", "#1a202c", "#4a5568", "#e2e8f0"

_UNPRINTABLE = re.compile("[^\t\n\r\x20-\ud7ff\ue000-\ufffd\U00010000-\U0010ffff]")


class Sheet:
    """The drawing."""

    def __init__(self, height: float, width: float = WIDTH) -> None:
        self._root = ElementTree.Element("svg", {
            "xmlns": "http://www.w3.org/2000/svg", "width": f"{width:g}", "height": f"{height:g}",
            "viewBox": f"0 0 {width:g} {height:g}", "font-family": "sans-serif", "fill": INK})
        self.draw("rect", width=width, height=height, rx=8, fill="#ffffff")

    def draw(self, shape: str, text: str = "", **attributes: str | float) -> None:
        """Add a shape; an underscore in an attribute's name stands for a hyphen."""
        element = ElementTree.SubElement(self._root, shape, {
            name.replace("_", "-"): value if isinstance(value, str) else f"{value:g}"
            for name, value in attributes.items()})
        element.text = _UNPRINTABLE.sub("\ufffd", text)

    def write(self, text: str, x: float, y: float, **attributes: str | float) -> None:
        """Add a line of text."""
        placed: dict[str, str | float] = {"x": x, "y": y, "font_size": 14}
        self.draw("text", text, **placed | attributes)

    def __str__(self) -> str:
        ElementTree.indent(self._root)
        return ElementTree.tostring(self._root, encoding="unicode") + "\n"
