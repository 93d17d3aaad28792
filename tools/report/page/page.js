"use strict";
// Draws the page from the JSON in it. What came from a client is only ever set as text.
(() => {
  const data = JSON.parse(document.getElementById("data").textContent);
  const $ = (id) => document.getElementById(id);
  // The order fixes each type's colour; --t12 is for any other.
  const kTypes = ["telephony", "longformaudio", "haptics", "alarms", "nonlongformaudio", "soundautoconfig", "alerts",
    "apiusage", "audiodeviceusage", "generic", "ondi", "standalone", "test"];
  const kAtOnce = 100;     // rows of a table
  const kMostBars = 1500;  // of the timeline
  const kMostPlots = 24;   // of one session

  const make = (tag, properties = {}, ...children) => {
    const element = Object.assign(document.createElement(tag), properties);
    element.append(...children);
    return element;
  };
  // A client's text, kept from turning what stands beside it around.
  const foreign = (text) => make("bdi", {textContent: text});
  const css = (name) => getComputedStyle(document.documentElement).getPropertyValue(name).trim();
  const colour = (type) => {
    const place = kTypes.indexOf(type);
    return css(`--t${place < 0 ? 12 : place}`);
  };

  // ---- texts
  const count = (n) => Number(n).toLocaleString("en-US");
  const number = (n) => typeof n !== "number" ? String(n)
    : Number.isInteger(n) ? count(n) : Math.abs(n) >= 1e6 || (n !== 0 && Math.abs(n) < 1e-3) ? n.toExponential(2)
    : n.toLocaleString("en-US", {maximumFractionDigits: 3});
  const iso = (seconds) => {
    const date = new Date(seconds * 1000);
    return isNaN(date) ? String(seconds) : date.toISOString();
  };
  const dateTime = (seconds) => seconds === null ? "" : iso(seconds).replace("T", " ").slice(0, 19);
  const tick = (seconds, span) => span > 20 * 86400 ? iso(seconds).slice(0, 10)
    : span > 86400 ? iso(seconds).slice(5, 16).replace("T", " ") : iso(seconds).slice(11, span > 600 ? 16 : 19);
  const duration = (seconds) => {
    if (seconds === null) return "";
    if (seconds < 10) return `${seconds.toFixed(2)} s`;
    if (seconds < 90) return `${seconds.toFixed(1)} s`;
    if (seconds < 5400) return `${(seconds / 60).toFixed(1)} min`;
    return seconds < 172800 ? `${(seconds / 3600).toFixed(1)} h` : `${(seconds / 86400).toFixed(1)} days`;
  };
  const durationTick = (seconds) => seconds < 90 ? `${number(seconds)} s` : duration(seconds);
  const bytes = (n) => n < 1024 ? `${n} B` : n < 1048576 ? `${(n / 1024).toFixed(1)} KiB` : `${(n / 1048576).toFixed(1)} MiB`;
  const plural = (n, one, many = one + "s") => `${count(n)} ${n === 1 ? one : many}`;

  // ---- tables: columns are [title, kind, of the row what to show]; kind n: a number, t: short, w: wide
  function table(into, caption, columns, rows, atFirst = kAtOnce) {
    if (rows.length === 0) {
      into.replaceChildren(make("p", {className: "empty", textContent: "No rows."}));
      return;
    }
    const kind = {n: "n", t: "t", w: "wide"};
    const head = make("tr", {}, ...columns.map(([title, k]) =>
      make("th", {scope: "col", className: k === "n" ? "n" : "", textContent: title})));
    const body = make("tbody");
    const stacked = columns.some(([, k]) => k === "w") ? "stack" : "";  // on a phone
    const scroll = make("div", {className: "scroll", tabIndex: 0},
      make("table", {className: stacked}, make("thead", {}, head), body));
    scroll.setAttribute("role", "region");
    scroll.setAttribute("aria-label", caption);
    const more = make("button", {type: "button", className: "more"});
    let shown = 0;
    const show = (some) => {
      const until = Math.min(rows.length, shown + some);
      for (; shown < until; ++shown) {
        body.append(make("tr", {}, ...columns.map(([, k, of]) => {
          const value = of(rows[shown]);
          return make("td", {className: kind[k] || ""}, value instanceof Node ? value : foreign(value ?? ""));
        })));
      }
      more.hidden = shown === rows.length;
      more.textContent = `Show more (${count(rows.length - shown)} left)`;
    };
    more.onclick = () => show(kAtOnce);
    show(atFirst);
    into.replaceChildren(scroll, more);
  }
  const empty = (text) => make("p", {className: "empty", textContent: text});

  // ---- charts
  const charts = new Map();  // by canvas
  Chart.defaults.animation = false;
  Chart.defaults.maintainAspectRatio = false;
  Chart.defaults.font.family = getComputedStyle(document.body).fontFamily;
  Chart.defaults.plugins.legend.display = false;
  function draw(canvas, label, configuration) {
    charts.get(canvas)?.destroy();
    Chart.defaults.color = css("--soft");
    Chart.defaults.borderColor = css("--grid");
    canvas.setAttribute("role", "img");
    canvas.setAttribute("aria-label", label);
    const chart = new Chart(canvas, configuration);
    charts.set(canvas, chart);
    return chart;
  }
  const kSteps = [1, 2, 5, 10, 15, 30, 60, 120, 300, 600, 900, 1800, 3600, 7200, 10800, 21600, 43200, 86400, 172800, 604800, 2592000];
  const timeAxis = (first, last) => ({
    type: "linear", min: first, max: last, offset: false, stacked: true, grid: {display: false},
    afterBuildTicks: (axis) => {
      const step = kSteps.find((each) => (last - first) / each <= Math.max(axis.width / 130, 2)) ?? kSteps[kSteps.length - 1];
      axis.ticks = [];
      for (let at = Math.ceil(first / step) * step; at <= last; at += step) axis.ticks.push({value: at});
    },
    ticks: {maxRotation: 0, autoSkip: false, callback: (value) => tick(value, last - first)}});

  // ---- what there is to show
  const kSession = ["relay", "id", "application", "type", "uid", "started", "ended", "how", "messages", "bytes"];
  const sessions = data.sessions.map((row) => Object.fromEntries(row.map((value, i) => [kSession[i], value])));
  const hidden = new Set();  // service types
  let opened = sessions.reduce((most, s) => most && most.messages >= s.messages ? most : s, null);

  function drawAbout() {
    const chosen = data.choice ? `, ${data.choice.trim()}` : "";
    $("about").replaceChildren("From ", foreign(data.store), chosen, `; made ${dateTime(data.made)}`);
    const engine = data.haptics.reduce((sum, row) => sum + (Number(row[1]) || 0), 0);
    const tile = (name, value, text, warn) => {
      const item = make("li", {className: warn ? "warn" : ""}, make("b", {textContent: value}), make("span", {textContent: text}));
      item.dataset.tile = name;
      return item;
    };
    $("tiles").replaceChildren(
      tile("sessions", count(data.sessionCount), data.openCount ? `sessions, ${count(data.openCount)} without an end` : "sessions"),
      tile("messages", count(data.messageCount), `relayed messages, ${bytes(data.messageBytes)}`),
      tile("applications", count(data.applicationCount), data.applicationCount === 1 ? "application" : "applications"),
      tile("haptics", duration(engine), "of haptics"),
      tile("lost", count(data.lostRows), data.lostRows === 1 ? "row removed or lost" : "rows removed or lost", data.lostRows > 0));
  }

  function drawOver() {
    if (!data.over) {
      $("over").closest("section").replaceChildren($("h-over"), empty("There are no messages here."));
      return;
    }
    const {first, step, counts} = data.over;
    const last = counts[counts.length - 1][0];
    const types = [...new Set(counts.map((row) => row[1]))].sort((a, b) => kTypes.indexOf(a) - kTypes.indexOf(b));
    const series = new Map(types.map((type) => [type, new Array(last + 1).fill(0)]));
    for (const [bucket, type, n] of counts) series.get(type)[bucket] = n;
    $("over-note").textContent = `${plural(data.messageCount, "relayed message")} in bars of ${durationTick(step)}, by service type, `
      + `from ${dateTime(first)} to ${dateTime(first + (last + 1) * step)}`;
    $("over-legend").replaceChildren(...types.map((type) => {
      const swatch = make("span", {className: "swatch"});
      swatch.style.background = colour(type);
      const button = make("button", {type: "button"}, swatch, foreign(type));
      button.setAttribute("aria-pressed", String(!hidden.has(type)));
      button.onclick = () => {
        if (!hidden.delete(type)) hidden.add(type);
        drawOver();
        [...$("over-legend").children][types.indexOf(type)].focus();
      };
      return button;
    }));
    const end = first + (last + 1) * step;
    draw($("over"), `Messages over time by service type, from ${dateTime(first)} to ${dateTime(end)}; the table below has the numbers`, {
      type: "bar",
      data: {datasets: types.map((type) => ({
        label: type, hidden: hidden.has(type), backgroundColor: colour(type), barPercentage: 1, categoryPercentage: 0.9,
        data: series.get(type).map((n, bucket) => ({x: first + (bucket + 0.5) * step, y: n}))}))},
      options: {
        parsing: false, interaction: {mode: "x", intersect: false},
        scales: {x: timeAxis(first, end), y: {stacked: true, beginAtZero: true, ticks: {precision: 0}}},
        plugins: {tooltip: {
          filter: (item) => item.parsed.y > 0,
          callbacks: {title: (items) => items.length ? dateTime(items[0].parsed.x - step / 2) : ""}}}}});
    table($("over-table"), "Messages over time by service type",
      [["From (UTC)", "t", (row) => dateTime(first + row[0] * step)], ["Service type", "t", (row) => row[1]],
        ["Messages", "n", (row) => count(row[2])]], counts);
  }

  function drawLanes() {
    if (sessions.length === 0) {
      $("lanes").closest("section").replaceChildren($("h-sessions"), empty("There are no sessions here."));
      $("session").hidden = true;
      return;
    }
    const bars = sessions.slice(0, kMostBars);
    const latest = Math.max(...bars.map((s) => s.ended ?? s.started), data.over ? data.over.first + data.over.step
      * (data.over.counts[data.over.counts.length - 1][0] + 1) : 0);
    const first = Math.min(...bars.map((s) => s.started));
    const span = Math.max(latest - first, 1e-3);
    const some = bars.length < data.sessionCount ? `The newest ${count(bars.length)} of ${plural(data.sessionCount, "session")}` :
      plural(data.sessionCount, "session");
    $("sessions-note").textContent = `${some}, a line for each application, coloured by service type. `
      + "Choose one to open it below; the arrow keys go from one to the next.";
    const lanes = new Map();
    for (const session of [...bars].sort((a, b) => a.started - b.started)) {
      if (!lanes.has(session.application)) lanes.set(session.application, []);
      lanes.get(session.application).push(session);
    }
    const buttons = [];
    const drawn = [...lanes].sort((a, b) => a[0] < b[0] ? -1 : 1).map(([application, own]) => {
      const ends = [];  // of the rows of this lane
      const track = make("div", {className: "track"});
      for (const session of own) {
        const end = session.ended ?? latest;
        let row = ends.findIndex((until) => until <= session.started);
        if (row < 0) row = ends.length < 12 ? ends.push(0) - 1 : ends.indexOf(Math.min(...ends));
        ends[row] = Math.max(end, session.started + span / 150);
        const button = make("button", {type: "button", className: session.ended === null ? "open" : "", tabIndex: -1,
          title: `${session.type} ${session.id}, ${dateTime(session.started)}, ${session.ended === null ? "no end" : duration(end - session.started)}`});
        button.setAttribute("aria-label", `${session.application}: ${button.title}`);
        button.style.left = `${(session.started - first) / span * 100}%`;
        button.style.width = `${Math.max(end - session.started, 0) / span * 100}%`;
        button.style.top = `${0.2 + row * 1.25}rem`;
        button.style.background = colour(session.type);
        button.onclick = () => open(session, true);
        buttons.push([session, button]);
        track.append(button);
      }
      track.style.height = `${0.4 + ends.length * 1.25 - 0.2}rem`;
      return make("div", {className: "lane"}, make("span", {title: application}, foreign(application)), track);
    });
    buttons.sort((a, b) => a[0].started - b[0].started);
    buttons.forEach(([, button], place) => button.onkeydown = (event) => {
      const to = {ArrowRight: place + 1, ArrowDown: place + 1, ArrowLeft: place - 1, ArrowUp: place - 1, Home: 0, End: buttons.length - 1}[event.key];
      if (to === undefined || !buttons[to]) return;
      event.preventDefault();
      button.tabIndex = -1;
      buttons[to][1].tabIndex = 0;
      buttons[to][1].focus();
    });
    const steps = [0, 0.5, 1].map((part) => make("span", {textContent: tick(first + part * span, span)}));
    $("lanes").replaceChildren(...drawn, make("div", {className: "scale"}, make("span"), make("div", {}, ...steps)));
    $("lanes").mark = () => {
      for (const [session, button] of buttons) {
        button.setAttribute("aria-current", String(session === opened));
        button.tabIndex = session === opened ? 0 : -1;
      }
      if (!buttons.some(([session]) => session === opened) && buttons.length) buttons[0][1].tabIndex = 0;
    };
    table($("sessions-table"), "Sessions",
      [["Started (UTC)", "t", (s) => dateTime(s.started)], ["Identifier", "n", (s) => s.id], ["Application", "t", (s) => s.application],
        ["Service type", "t", (s) => s.type], ["Lasted", "n", (s) => s.ended === null ? "" : duration(s.ended - s.started)],
        ["Ended", "t", (s) => s.how ?? (s.ended === null ? "no end" : "")], ["Messages", "n", (s) => count(s.messages)],
        ["Size", "n", (s) => bytes(s.bytes)]], sessions);
  }

  // ---- one session
  function chooseFrom() {
    $("choose").replaceChildren(...sessions.map((s, i) => make("option", {value: String(i),
      textContent: `${dateTime(s.started)}  \u2068${s.type}\u2069  \u2068${s.application}\u2069  ${s.id}`})));
    $("choose").onchange = () => open(sessions[Number($("choose").value)]);
    $("earlier").onclick = () => open(sessions[sessions.indexOf(opened) + 1]);
    $("later").onclick = () => open(sessions[sessions.indexOf(opened) - 1]);
  }
  const messagesOf = (session) => {
    const element = $(`m${session.relay}`);
    return element ? JSON.parse(element.textContent) : [];
  };

  function smallPlot(name, points, seconds, type) {
    const values = points.map((p) => p.y);
    const [least, most] = [values.reduce((a, b) => Math.min(a, b)), values.reduce((a, b) => Math.max(a, b))];
    const text = `${number(least)} to ${number(most)}`;
    const canvas = make("canvas");
    const figure = make("figure", {}, make("figcaption", {}, make("bdi", {textContent: name, title: name}), make("span", {textContent: text})),
      make("div", {className: "plot"}, canvas));
    return [figure, () => draw(canvas, `${name} against seconds since the start: ${plural(points.length, "value")}, ${text}`, {
      type: "line",
      data: {datasets: [{data: points, borderColor: colour(type), backgroundColor: colour(type), borderWidth: 1.5,
        pointRadius: points.length > 60 ? 0 : 2, pointHitRadius: 6}]},
      options: {
        parsing: false, normalized: true, interaction: {mode: "nearest", axis: "x", intersect: false},
        scales: {x: {type: "linear", min: 0, max: seconds, grid: {display: false}, ticks: {maxTicksLimit: 5, maxRotation: 0, callback: (v) => `${number(v)} s`}},
          y: {ticks: {maxTicksLimit: 4, callback: (v) => number(v)}}},
        plugins: {decimation: {enabled: true, algorithm: "min-max"},
          tooltip: {displayColors: false, callbacks: {title: (items) => `${number(items[0].parsed.x)} s`, label: (item) => number(item.parsed.y)}}}}})];
  }

  function orientationStrips(session, seconds) {
    const own = data.orientation.filter((row) => row[0] === session.relay);
    return [["device_orientation", "Device"], ["ui_orientation", "Interface"]].flatMap(([key, title]) => {
      const changes = own.filter((row) => row[1] === key);
      if (changes.length === 0) return [];
      const names = [...new Set(changes.map((row) => row[2]))];
      const strip = make("div", {className: "strip"});
      strip.setAttribute("role", "img");
      strip.setAttribute("aria-label", `${title}: ${changes.map((row) => `${row[2]} after ${duration(row[3])}`).join(", ")}`);
      changes.forEach(([, , name, at], i) => {
        const until = i + 1 < changes.length ? changes[i + 1][3] : seconds;
        const part = make("span", {title: `${name}, ${duration(at)}`}, foreign(name));
        part.style.left = `${at / seconds * 100}%`;
        part.style.width = `${Math.max(until - at, 0) / seconds * 100}%`;
        part.style.background = `color-mix(in srgb, ${css(`--t${names.indexOf(name) % 12}`)} 30%, transparent)`;
        strip.append(part);
      });
      return [make("span", {className: "note", textContent: title}), strip];
    });
  }

  function open(session, scroll = false) {
    if (!session) return;
    opened = session;
    const place = sessions.indexOf(session);
    $("choose").value = String(place);
    $("earlier").disabled = place === sessions.length - 1;
    $("later").disabled = place === 0;
    $("lanes").mark?.();
    const messages = messagesOf(session);
    const from = session.started * 1000;
    const series = new Map();  // of numbers, by key
    for (const [at, , payload] of messages) {
      for (const [key, value] of Object.entries(payload ?? {})) {
        if (typeof value !== "number") continue;
        if (!series.has(key)) series.set(key, []);
        series.get(key).push({x: Math.max(at - from, 0) / 1000, y: value});
      }
    }
    const lastMessage = messages.length ? (messages[messages.length - 1][0] - from) / 1000 : 0;
    const seconds = Math.max(session.ended === null ? lastMessage : session.ended - session.started, 0.001);
    const drivers = data.drivers.filter((row) => row[0] === session.relay);
    for (const [, counter] of drivers) {  // said once, at the end: a table says more
      if (series.get(counter)?.length === 1) series.delete(counter);
    }
    const plotted = [...series].filter(([, points]) => points.length > 1).slice(0, kMostPlots);
    const facts = [["Identifier", session.id], ["Application", session.application], ["Service type", session.type],
      ["Started", dateTime(session.started)], ["Lasted", session.ended === null ? "no end is recorded" : duration(session.ended - session.started)],
      ["Ended", session.how ?? ""], ["Messages", `${count(session.messages)}, ${bytes(session.bytes)}`], ["User", session.uid === null ? "" : String(session.uid)]];
    const parts = [make("dl", {}, ...facts.filter(([, value]) => value !== "").map(([name, value]) =>
      make("div", {}, make("dt", {textContent: name}), make("dd", {}, foreign(value)))))];
    const small = plotted.map(([name, points]) => smallPlot(name, points, seconds, session.type));
    if (small.length) {
      const left = series.size - plotted.length;
      parts.push(make("h3", {textContent: "Values against time"}), make("div", {className: "small"}, ...small.map(([figure]) => figure)));
      if (left > 0) parts.push(make("p", {className: "note", textContent: `${plural(left, "key")} more, with one value or beyond ${kMostPlots}, in the table.`}));
      const details = make("div");
      parts.push(make("details", {}, make("summary", {textContent: "As a table"}), details));
      table(details, "Numbers of this session", [["Key", "t", (row) => row[0]], ["Values", "n", (row) => count(row[1].length)],
        ["Least", "n", (row) => number(row[1].reduce((a, p) => Math.min(a, p.y), Infinity))],
        ["Mean", "n", (row) => number(row[1].reduce((a, p) => a + p.y / row[1].length, 0))],
        ["Most", "n", (row) => number(row[1].reduce((a, p) => Math.max(a, p.y), -Infinity))],
        ["Last", "n", (row) => number(row[1][row[1].length - 1].y)]], [...series]);
    }
    const strips = orientationStrips(session, seconds);
    if (strips.length) parts.push(make("h3", {textContent: "Orientation"}), ...strips);
    if (drivers.length) {
      const into = make("div");
      parts.push(make("h3", {textContent: "Growth of driver counters"}), into);
      table(into, "Growth of driver counters", [["Counter", "t", (row) => row[1]], ["Growth", "n", (row) => number(row[2])]], drivers);
    }
    parts.push(make("h3", {textContent: "Messages"}));
    const into = make("div");
    parts.push(into);
    if (messages.length === 0) {
      into.append(empty(session.messages > 0 ? "Its messages are not in this page: only the newest of all are. Choose it with --session."
        : "No message of this session is stored."));
    } else {
      if (messages.length < session.messages - 1)
        parts.push(make("p", {className: "note", textContent: `The newest ${count(messages.length)} of its messages.`}));
      table(into, "Messages of this session", [["After", "n", (row) => duration(Math.max(row[0] - from, 0) / 1000)], ["Kind", "t", (row) => data.kinds[row[1]]],
        ["Payload", "w", (row) => make("span", {}, ...Object.entries(row[2] ?? {}).map(([key, value]) =>
          make("span", {className: "pair"}, make("i", {}, foreign(key)), " ", foreign(typeof value === "object" ? JSON.stringify(value) : String(value)))))]], messages, 25);
    }
    $("opened").replaceChildren(...parts);
    for (const canvas of charts.keys()) {
      if (canvas.isConnected) continue;
      charts.get(canvas).destroy();
      charts.delete(canvas);
    }
    for (const [, later] of small) later();
    if (scroll) $("session").scrollIntoView();
  }

  // ---- applications and clients
  function horizontal(name, label, rows, colourOf) {
    $(`${name}-plot`).style.height = `${Math.max(rows.length * 2 + 2.5, 5)}rem`;
    draw($(name), label, {
      type: "bar",
      data: {labels: rows.map((row) => row[0].length > 28 ? row[0].slice(0, 27) + "\u2026" : row[0]),
        datasets: [{data: rows.map((row) => row[1]), backgroundColor: colourOf, borderRadius: 3, maxBarThickness: 22}]},
      options: {indexAxis: "y", scales: {x: {beginAtZero: true, ticks: {maxRotation: 0, autoSkipPadding: 24, callback: durationTick}}, y: {grid: {display: false}}},
        plugins: {tooltip: {displayColors: false, callbacks: {label: (item) => duration(item.parsed.x)}}}}});
  }
  const nothing = (name, text) => $(name).closest("section").replaceChildren($(`h-${name}`), empty(text));

  function drawHaptics() {
    if (data.haptics.length === 0) return nothing("haptics", "No haptics engine ran.");
    const rows = data.haptics.map(([application, seconds, runs]) => [application, Number(seconds) || 0, runs]);
    $("haptics-note").textContent = "How long haptics engines were on, as the power log has it";
    horizontal("haptics", "Haptics time by application; the table below has the numbers", rows.slice(0, 15), colour("haptics"));
    table($("haptics-table"), "Haptics by application", [["Application", "t", (row) => row[0]], ["Engine on", "n", (row) => duration(row[1])],
      ["Records", "n", (row) => count(row[2])]], rows);
  }

  function drawUptimes() {
    if (data.uptimes.length === 0) return nothing("uptimes", "No client has left yet.");
    const shown = data.uptimes.slice(0, 15);
    $("uptimes-note").textContent = `How long clients were connected${shown.length < data.uptimes.length ? `: the longest ${shown.length} of ${count(data.uptimes.length)}` : ""}`;
    horizontal("uptimes", "Client uptimes; the table below has the numbers", shown.map((row) => [row[1] ?? "", row[2]]), css("--t6"));
    table($("uptimes-table"), "Client uptimes", [["Client", "t", (row) => row[1]], ["Connected", "n", (row) => duration(row[2])],
      ["Left (UTC)", "t", (row) => dateTime(row[0])]], data.uptimes);
  }

  function drawLosses() {
    if (data.losses.length === 0) return nothing("losses-table", "Nothing was removed, left out or lost.");
    $("losses-note").textContent = `${plural(data.lossCount, "row")} of the ledger, the newest first`;
    table($("losses-table"), "What is not there, and why", [["Time (UTC)", "t", (row) => dateTime(row[0])], ["Cause", "t", (row) => row[1]],
      ["Table", "t", (row) => row[2] ?? ""], ["Rows", "n", (row) => count(row[3] ?? 0)], ["Meaning", "w", (row) => row[4] ?? ""],
      ["Detail", "w", (row) => row[5] ?? ""]], data.losses);
  }

  function drawAll() {
    drawAbout();
    drawOver();
    drawLanes();
    if (opened) open(opened);
    drawHaptics();
    drawUptimes();
    drawLosses();
  }
  chooseFrom();
  drawAll();
  matchMedia("(prefers-color-scheme: dark)").addEventListener("change", () => location.reload());
  document.documentElement.dataset.drawn = "yes";
})();
