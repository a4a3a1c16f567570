"""Curves in panels, as pictures that a web page can show."""

from __future__ import annotations

import math
from collections.abc import Callable, Sequence
from dataclasses import dataclass

from lab.sheet import Sheet

_LEFT, _WIDTH, _TOP, _GAP = 80, 1090, 82, 86
_COLOURS = ("#2b6cb0", "#c05f10", "#2b8a4b", "#7b2d8b")
_PALE = "#e2e8f0"
Points = Sequence[tuple[float, float]]


@dataclass(frozen=True)
class Panel:
    """Named curves over the same axes; both are `logarithmic` or begin at zero."""

    title: str
    x_name: str
    curves: dict[str, Points]
    logarithmic: bool = False


class _Axis:
    """Values to a share of the axis, and the round numbers on it."""

    def __init__(self, values: Sequence[float], logarithmic: bool) -> None:
        most = max(values)
        self.place: Callable[[float], float] = lambda value: value / most
        if logarithmic:
            low, high = (math.floor(math.log10(min(values))), math.ceil(math.log10(most)))
            low -= high - low < 2  # a level curve is in the middle
            self.ticks = [10.0 ** power for power in range(low, high + 1)]
            self.place = lambda value: (math.log10(value) - low) / (high - low)
        else:
            step = next(base * 10 ** power for power in range(12) for base in (1, 2, 5)
                        if base * 10 ** power * 6 >= most)
            self.ticks = [step * count for count in range(int(most / step) + 1)]


def svg(title: str, panels: Sequence[Panel], columns: int, height: int) -> str:
    """Panels of the same size, row by row."""
    width = (_WIDTH - _LEFT * (columns - 1)) / columns
    sheet = Sheet(_TOP + math.ceil(len(panels) / columns) * (height + _GAP) - 20)
    sheet.write(title, 30, 34, font_size=18, font_weight="bold")
    for number, panel in enumerate(panels):
        row, column = divmod(number, columns)
        _draw(sheet, panel, _LEFT + column * (width + _LEFT), _TOP + row * (height + _GAP), width,
              height)
    return str(sheet)


def _draw(sheet: Sheet, panel: Panel, left: float, top: float, width: float,
          height: float) -> None:
    points = [point for curve in panel.curves.values() for point in curve]
    across, upward = (_Axis(values, panel.logarithmic) for values in zip(*points))
    sheet.write(panel.title, left, top - 20, font_weight="bold")
    small: dict[str, str | float] = {"font_size": 11}
    for tick in upward.ticks:
        y = top + height * (1 - upward.place(tick))
        sheet.draw("line", x1=left, x2=left + width, y1=y, y2=y, stroke=_PALE)
        sheet.write(f"{tick:,.10g}", left - 6, y + 4, text_anchor="end", **small)
    for tick in across.ticks:
        x = left + width * across.place(tick)
        sheet.draw("line", x1=x, x2=x, y1=top, y2=top + height, stroke=_PALE)
        sheet.write(f"{tick:,.10g}", x, top + height + 15, text_anchor="middle", **small)
    sheet.write(panel.x_name, left + width, top + height + 30, text_anchor="end", **small)
    for (name, curve), colour in zip(panel.curves.items(), _COLOURS):
        corners = " ".join(f"{left + width * across.place(x):.1f},"
                           f"{top + height * (1 - upward.place(y)):.1f}" for x, y in curve)
        sheet.draw("polyline", points=corners, fill="none", stroke=colour, stroke_width=2)
        sheet.write(name, left + _COLOURS.index(colour) * 210, top - 5, fill=colour, **small)
