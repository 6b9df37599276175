"""Draws how cost grows with size, as an SVG that is readable on light and dark pages."""

import html
import math

_PANEL = 400  # Width of the space for lines, of one panel.
_HEIGHT = 260
_LEFT = 64
_TOP = 44
_BOTTOM = 48
_LEGEND = 150
_COLOURS = ("#2b7fc4", "#d9822b", "#3f9b4f", "#c2459c", "#8a6bd1", "#b0892b", "#d1495b", "#2a9d9d")
_STYLE = """
  text { font: 12px sans-serif; fill: #555; }
  .title { font-weight: bold; }
  .axis { stroke: #777; fill: none; }
  .grid { stroke: #9995; fill: none; }
  .series { fill: none; stroke-width: 2; }
  @media (prefers-color-scheme: dark) { text { fill: #bbb; } .axis { stroke: #999; } }
"""


def series_of(figures, unit):
    """{name: [(size, value)]} of the cases that are called NAME/SIZE and have this unit; those
    with one size alone show no growth."""
    series = {}
    for figure in figures:
        name, _, size = figure["case"].rpartition("/")
        if name and size.isdigit() and figure["unit"] == unit:
            series.setdefault(name, []).append((int(size), figure["value"]))
    return {name: sorted(points) for name, points in series.items() if len(points) > 1}


def _nice_step(most, count=5):
    """A step of 1, 2 or 5 times a power of ten that divides 0..most into about so many parts."""
    rough = most / count
    power = 10 ** math.floor(math.log10(rough))
    return next(power * digit for digit in (1, 2, 5, 10) if power * digit >= rough)


def _panel(x, title, series):
    """The lines of one panel whose left edge is at x."""
    sizes = [size for points in series.values() for size, _ in points]
    low, high = math.floor(math.log10(min(sizes))), math.ceil(math.log10(max(sizes)))
    high = max(high, low + 1)
    most = max(value for points in series.values() for _, value in points)
    step = _nice_step(most)
    top = step * math.ceil(most / step)

    def place(size, value):
        return (
            x + _PANEL * (math.log10(size) - low) / (high - low),
            _TOP + _HEIGHT * (1 - value / top),
        )

    lines = [f'<text class="title" x="{x}" y="{_TOP - 18}">{html.escape(title)}</text>']
    for power in range(low, high + 1):
        at = place(10**power, 0)[0]
        lines.append(f'<path class="grid" d="M{at:.1f} {_TOP}V{_TOP + _HEIGHT}"/>')
        lines.append(
            f'<text x="{at:.1f}" y="{_TOP + _HEIGHT + 18}" text-anchor="middle">{10**power:,}</text>'
        )
    for i in range(round(top / step) + 1):
        at = place(10**low, i * step)[1]
        lines.append(f'<path class="grid" d="M{x} {at:.1f}h{_PANEL}"/>')
        lines.append(
            f'<text x="{x - 8}" y="{at + 4:.1f}" text-anchor="end">{i * step:,g}</text>'
        )
    lines.append(f'<path class="axis" d="M{x} {_TOP}v{_HEIGHT}h{_PANEL}"/>')
    for i, (name, points) in enumerate(series.items()):
        colour = _COLOURS[i % len(_COLOURS)]
        dash = ' stroke-dasharray="6 4"' if i >= len(_COLOURS) else ""
        placed = [place(*point) for point in points]
        path = "L".join(f"{px:.1f} {py:.1f}" for px, py in placed)
        lines.append(f'<path class="series" stroke="{colour}"{dash} d="M{path}"/>')
        lines += [f'<circle cx="{px:.1f}" cy="{py:.1f}" r="3" fill="{colour}"/>' for px, py in placed]
        y = _TOP + 8 + 18 * i
        lines.append(
            f'<path class="series" stroke="{colour}"{dash} d="M{x + _PANEL + 12} {y}h18"/>'
            f'<text x="{x + _PANEL + 36}" y="{y + 4}">{html.escape(name)}</text>'
        )
    return lines


def draw(figures):
    """The SVG's text; None when no case has several sizes."""
    panels = [
        (title, series)
        for title, unit in (
            ("ns a line, by lines of a queue", "ns/line"),
            ("µs a file, by files of a tree", "us/file"),
        )
        if (series := series_of(figures, unit))
    ]
    if not panels:
        return None
    width_of_one = _LEFT + _PANEL + _LEGEND
    width, height = width_of_one * len(panels), _TOP + _HEIGHT + _BOTTOM
    lines = [
        f'<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 {width} {height}" '
        f'width="{width}" height="{height}" role="img">',
        "<title>How cost grows with size</title>",
        f"<style>{_STYLE}</style>",
    ]
    for i, (title, series) in enumerate(panels):
        lines += _panel(_LEFT + i * width_of_one, title, series)
    return "\n".join([*lines, "</svg>", ""])
