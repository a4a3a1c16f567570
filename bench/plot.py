"""Curves in panels, as pictures that a web page can show."""

from __future__ import annotations

import math
from collections.abc import Sequence
from dataclasses import dataclass

from lab.picture import Sheet

_LEFT, _WIDTH, _TOP, _GAP = 80, 1090, 62, 66
_COLOURS = ("#2b6cb0", "#c05f10", "#2b8a4b", "#7b2d8b", "#c53030", "#34495e")
_PALE = "#e2e8f0"
Points = Sequence[tuple[float, float]]


@dataclass(frozen=True)
class Panel:
    """Named curves over the same axes; both are `logarithmic` or begin at zero."""

    title: str
    x_name: str
    curves: dict[str, Points]
    logarithmic: bool = False
    marks: bool = False


class _Axis:
    """Values to a share of the axis, and the round numbers on it."""

    def __init__(self, values: Sequence[float], logarithmic: bool) -> None:
        self.least, self.most = 0.0, max(values) or 1
        self._logarithmic = logarithmic
        if logarithmic:
            self.least = 10.0 ** math.floor(math.log10(min(values)))
            self.most = 10.0 ** math.ceil(math.log10(max(values)))
            if self.most < self.least * 100:  # a level curve is in the middle
                self.least /= 10

    def place(self, value: float) -> float:
        """0 at the least value, 1 at the greatest."""
        if self._logarithmic:
            return math.log(value / self.least) / math.log(self.most / self.least)
        return value / self.most

    def ticks(self) -> list[float]:
        """Three to seven numbers."""
        if self._logarithmic:
            return [self.least * 10 ** power
                    for power in range(round(math.log10(self.most / self.least)) + 1)]
        step = next(base * 10 ** power for power in range(-3, 12) for base in (1, 2, 5)
                    if base * 10 ** power * 6 >= self.most)
        return [step * count for count in range(int(self.most / step) + 1)]


def svg(title: str, panels: Sequence[Panel], columns: int, height: int) -> str:
    """Panels of the same size, row by row."""
    width = (_WIDTH - _LEFT * (columns - 1)) / columns
    rows = math.ceil(len(panels) / columns)
    sheet = Sheet(_TOP + rows * (height + _GAP) + 14)
    sheet.write(title, 30, 34, font_size=18, font_weight="bold")
    for number, panel in enumerate(panels):
        row, column = divmod(number, columns)
        _draw(sheet, panel, _LEFT + column * (width + _LEFT), _TOP + 20 + row * (height + _GAP),
              width, height - 20)
    return str(sheet)


def _draw(sheet: Sheet, panel: Panel, left: float, top: float, width: float,
          height: float) -> None:
    points = [point for curve in panel.curves.values() for point in curve]
    across = _Axis([x for x, _ in points], panel.logarithmic)
    upward = _Axis([y for _, y in points], panel.logarithmic)
    sheet.write(panel.title, left, top - 20, font_weight="bold")
    for tick in upward.ticks():
        y = top + height * (1 - upward.place(tick))
        sheet.draw("line", x1=left, x2=left + width, y1=y, y2=y, stroke=_PALE)
        sheet.write(f"{tick:,.10g}", left - 6, y + 4, text_anchor="end", font_size=11)
    for tick in across.ticks():
        x = left + width * across.place(tick)
        sheet.draw("line", x1=x, x2=x, y1=top, y2=top + height, stroke=_PALE)
        sheet.write(f"{tick:,.10g}", x, top + height + 15, text_anchor="middle", font_size=11)
    sheet.write(panel.x_name, left + width, top + height + 29, text_anchor="end", font_size=12)
    legend = left
    for (name, curve), colour in zip(panel.curves.items(), _COLOURS):
        corners = [(left + width * across.place(x), top + height * (1 - upward.place(y)))
                   for x, y in curve]
        sheet.draw("polyline", points=" ".join(f"{x:.1f},{y:.1f}" for x, y in corners),
                   fill="none", stroke=colour, stroke_width=2)
        for x, y in corners if panel.marks else ():
            sheet.draw("circle", cx=x, cy=y, r=3, fill=colour)
        if len(panel.curves) > 1:
            sheet.write(name, legend, top - 5, fill=colour, font_size=12)
            legend += len(name) * 6.6 + 20
