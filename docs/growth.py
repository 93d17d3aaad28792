#!/usr/bin/env python3
"""Draws docs/growth.svg from the figures of `./bench --growth FILE`: docs/growth.py FILE

Nothing but the standard library: the picture is plain SVG. Prints the same figures as Markdown tables.
"""
import json
import math
import sys

WIDTH, HEIGHT, LEFT, TOP, PLOT_W, PLOT_H = 860, 620, 70, 40, 310, 200


def nice(most):
    """A round number at or above, so that four lines below it are round too."""
    power = 10 ** math.floor(math.log10(most))
    return next(m * power for m in (1, 2, 4, 6, 8, 10) if m * power >= most)


def plot(x0, y0, title, x_title, series, unit):
    xs = [p[0] for _, _, points in series for p in points]
    top = nice(max(p[1] for _, _, points in series for p in points))

    def x(v):
        return x0 + PLOT_W * math.log10(v) / max(1, math.log10(max(xs)))

    def y(v):
        return y0 + PLOT_H * (1 - v / top)

    out = [f'<text x="{x0}" y="{y0 - 16}" class="t">{title}</text>',
           f'<path d="M{x0} {y0}V{y0 + PLOT_H}H{x0 + PLOT_W}" class="a"/>']
    for v in sorted(set(xs)):
        out.append(f'<text x="{x(v):.0f}" y="{y0 + PLOT_H + 18}" text-anchor="middle">{v}</text>')
    for i in range(5):
        v = top * i / 4
        out.append(f'<text x="{x0 - 6}" y="{y(v) + 4:.0f}" text-anchor="end">{v:,.0f}</text>'
                   f'<path d="M{x0} {y(v):.1f}h{PLOT_W}" class="g"/>')
    out.append(f'<text x="{x0 + PLOT_W / 2}" y="{y0 + PLOT_H + 38}" text-anchor="middle">{x_title}</text>')
    for i, (name, colour, points) in enumerate(series):
        line = " ".join(f"{x(a):.1f},{y(b):.1f}" for a, b in points)
        out.append(f'<polyline points="{line}" fill="none" stroke="{colour}" stroke-width="2"/>')
        out += [f'<circle cx="{x(a):.1f}" cy="{y(b):.1f}" r="3.5" fill="{colour}"/>' for a, b in points]
        out.append(f'<text x="{x0 + 8}" y="{y0 + PLOT_H - 12 - 16 * i}" fill="{colour}">{name} ({unit})</text>')
    return "\n".join(out)


def table(rows, names):
    print("| " + " | ".join(names.values()) + " |\n|" + "---:|" * len(names))
    for row in rows:
        print("| " + " | ".join(f"{row[k]:,}" for k in names) + " |")
    print()


def main(source):
    with open(source) as f:
        data = json.load(f)
    clients, sessions = data["clients"], data["sessions"]
    table(clients, {"n": "clients", "messages_per_s": "messages/s", "cpu_us_per_message": "CPU us/message",
                    "kib_each": "KiB each"})
    table(sessions, {"n": "started sessions", "messages_per_s": "messages accepted/s",
                     "deliveries_stored_per_s": "deliveries stored/s", "cpu_us_per_delivery": "CPU us/delivery",
                     "kib_each": "KiB each"})
    right, below = LEFT + PLOT_W + 110, TOP + PLOT_H + 90
    body = plot(LEFT, TOP, "Messages against clients", "clients, each with a started session",
                [("accepted", "#0a6", [(r["n"], r["messages_per_s"]) for r in clients])], "1/s")
    body += plot(right, TOP, "Deliveries against sessions", "started sessions that each message reaches",
                 [("stored", "#06c", [(r["n"], r["deliveries_stored_per_s"]) for r in sessions])], "1/s")
    body += plot(LEFT, below, "Memory against clients", "clients, each with a started session",
                 [("each", "#0a6", [(r["n"], r["kib_each"]) for r in clients])], "KiB")
    body += plot(right, below, "Memory against sessions", "started sessions of one client",
                 [("each", "#06c", [(r["n"], r["kib_each"]) for r in sessions])], "KiB")
    with open(__file__.rsplit("/", 1)[0] + "/growth.svg" if "/" in __file__ else "growth.svg", "w") as f:
        f.write(f'<svg xmlns="http://www.w3.org/2000/svg" width="{WIDTH}" height="{HEIGHT}" '
                f'font-family="sans-serif" font-size="11">\n<style>.t{{font-size:14px;font-weight:bold}}'
                f'.a{{fill:none;stroke:#333}}.g{{stroke:#ddd}}</style>\n'
                f'<rect width="100%" height="100%" fill="#fff"/>\n{body}\n</svg>\n')


main(sys.argv[1])
