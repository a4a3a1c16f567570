"""Measurements over time as a picture: one panel for each series, on a ground of its own."""

from __future__ import annotations

from collections.abc import Sequence
from dataclasses import dataclass

from lab.sheet import Sheet

_LEFT, _RIGHT, _TOP, _PANEL, _GAP = 110, 1140, 70, 90, 44
_LINE, _PALE, _SHADE = "#2b6cb0", "#e2e8f0", "#fbe9d7"


@dataclass(frozen=True)
class Series:
    """Values by their hour."""

    name: str
    points: Sequence[tuple[float, float]]


def svg(title: str, series: Sequence[Series], weather: Sequence[str]) -> str:
    """Each series in a panel whose scale begins at zero; hours that were not quiet are shaded."""
    bottom = _TOP + len(series) * (_PANEL + _GAP)
    sheet = Sheet(bottom + 30)
    unit = (_RIGHT - _LEFT) / len(weather)
    sheet.write(title, 30, 36, font_size=18, font_weight="bold")
    for hour, kind in enumerate(weather):
        if kind != "quiet":
            sheet.draw("rect", x=_LEFT + hour * unit, y=_TOP, width=unit,
                       height=bottom - _GAP - _TOP, fill=_SHADE)
    for number, one in enumerate(series):
        _panel(sheet, one, _TOP + number * (_PANEL + _GAP), unit)
    for hour in range(0, len(weather) + 1, max(1, len(weather) // 10)):
        sheet.write(str(hour), _LEFT + hour * unit, bottom - _GAP + 18, text_anchor="middle")
    sheet.write("device hours; shaded: " + ", ".join(sorted({*weather} - {"quiet"})), _LEFT,
                bottom + 6)
    return str(sheet)


def _panel(sheet: Sheet, series: Series, top: float, unit: float) -> None:
    most = max(value for _, value in series.points) or 1
    base = top + _PANEL
    sheet.write(series.name, _LEFT, top - 6, font_weight="bold")
    for value, y in ((most, top), (0, base)):
        sheet.draw("line", x1=_LEFT, x2=_RIGHT, y1=y, y2=y, stroke=_PALE)
        sheet.write(f"{value:,.0f}", _LEFT - 8, y + 5, text_anchor="end")
    line = " ".join(f"{_LEFT + hour * unit:.1f},{base - value / most * _PANEL:.1f}"
                    for hour, value in _corners(series.points))
    sheet.draw("polyline", points=line, fill="none", stroke=_LINE, stroke_width=2)


def _corners(points: Sequence[tuple[float, float]]) -> Sequence[tuple[float, float]]:
    """The points without those in the middle of a level stretch."""
    around = zip([None, *points], points, [*points[1:], None])
    return [point for before, point, after in around
            if not before or not after or not before[1] == point[1] == after[1]]
