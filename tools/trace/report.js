// The page of `osutils trace report`. Calls are kept in lanes: one for each thread and depth, in
// order of time, so that drawing needs only a binary search for each pixel.
"use strict";

(() => {
  const kLaneHeight = 18;
  const kProcessHeight = 22;
  const kThreadGap = 6;
  const kGutter = 120;  // pixels for the names of threads
  const kCell = 2;      // calls that are narrower are drawn as one
  const kMostListed = 100;

  // The bits of a call's state, as the report's writer sets them.
  const kFailed = 1;
  const kUnknown = 2;
  const kUnfinished = 4;
  const kNoEntry = 8;
  const kMergedFunction = 0xffffffff;

  const byId = (id) => document.getElementById(id);
  const trace = JSON.parse(byId("trace").textContent);
  const data = load(trace);
  const rows = layOut(data);
  const has_merged = data.name.includes(kMergedFunction);

  let selected = -1;
  let matched = null;        // for each call whether it matches the search
  let matched_before = null; // how many match before each call
  let transform = d3.zoomIdentity;
  let scale = null;
  let colours = {};

  // ---- Reading the records ----

  function chunks(name) {
    return [...document.querySelectorAll(`script[data-records=${name}]`)].map((element) => {
      const values = JSON.parse(element.textContent);
      element.remove();
      return values;
    });
  }

  function load(trace) {
    const kCallFields = 7;
    const kMergedFields = 8;
    const call_chunks = chunks("calls");
    const merged_chunks = chunks("merged");
    const count = d3.sum(call_chunks, (chunk) => chunk.length / kCallFields) +
      d3.sum(merged_chunks, (chunk) => chunk.length / kMergedFields);
    const read = {
      thread: new Uint32Array(count), depth: new Uint32Array(count), name: new Uint32Array(count),
      begin: new Float64Array(count), end: new Float64Array(count), state: new Uint8Array(count),
      calls: new Float64Array(count).fill(1), failed: new Float64Array(count), code: new Array(count).fill(null),
      time: new Float64Array(count), inner: new Float64Array(count),
    };
    let at = 0;
    for (const chunk of call_chunks) {
      let begin = 0;
      for (let i = 0; i < chunk.length; i += kCallFields, ++at) {
        begin += chunk[i + 3];
        read.thread[at] = chunk[i];
        read.depth[at] = chunk[i + 1];
        read.name[at] = chunk[i + 2];
        read.begin[at] = begin;
        read.end[at] = begin + chunk[i + 4];
        read.state[at] = chunk[i + 5];
        read.code[at] = chunk[i + 6];
        read.failed[at] = chunk[i + 5] & kFailed ? 1 : 0;
      }
    }
    for (const chunk of merged_chunks) {
      let begin = 0;
      for (let i = 0; i < chunk.length; i += kMergedFields, ++at) {
        begin += chunk[i + 2];
        read.thread[at] = chunk[i];
        read.depth[at] = chunk[i + 1];
        read.name[at] = kMergedFunction;
        read.begin[at] = begin;
        read.end[at] = begin + chunk[i + 3];
        read.calls[at] = chunk[i + 4];
        read.failed[at] = chunk[i + 5];
        read.time[at] = chunk[i + 6];
        read.inner[at] = chunk[i + 7];
      }
    }
    return intoLanes(read, count, readMessages());
  }

  function readMessages() {
    const kFields = 6;
    const messages = [];
    for (const chunk of chunks("messages")) {
      let time = 0;
      for (let i = 0; i < chunk.length; i += kFields) {
        time += chunk[i + 2];
        messages.push({thread: chunk[i], depth: chunk[i + 1], time, is_error: chunk[i + 3] === 1,
                       name: chunk[i + 4], text: chunk[i + 5], call: -1});
      }
    }
    return messages;
  }

  function intoLanes(read, count, messages) {
    const depths = new Uint32Array(trace.threads.length);
    for (let i = 0; i < count; ++i) {
      depths[read.thread[i]] = Math.max(depths[read.thread[i]], read.depth[i] + 1);
    }
    const first_lane = new Uint32Array(depths.length + 1);
    for (let i = 0; i < depths.length; ++i) first_lane[i + 1] = first_lane[i] + depths[i];
    const lanes = first_lane[depths.length];
    const laneOf = (i) => first_lane[read.thread[i]] + read.depth[i];

    const from = new Uint32Array(lanes + 1);
    for (let i = 0; i < count; ++i) ++from[laneOf(i) + 1];
    for (let lane = 0; lane < lanes; ++lane) from[lane + 1] += from[lane];
    const next = from.slice(0, lanes);
    const order = new Uint32Array(count);
    for (let i = 0; i < count; ++i) order[next[laneOf(i)]++] = i;
    for (let lane = 0; lane < lanes; ++lane) sortLane(order.subarray(from[lane], from[lane + 1]), read.begin);

    const sorted = {first_lane, from, count, messages, lane: new Uint32Array(count)};
    for (const field of ["thread", "depth", "name", "begin", "end", "state", "calls", "failed", "time", "inner"]) {
      const values = new read[field].constructor(count);
      for (let i = 0; i < count; ++i) values[i] = read[field][order[i]];
      sorted[field] = values;
    }
    sorted.code = Array.from(order, (i) => read.code[i]);
    for (let i = 0; i < count; ++i) sorted.lane[i] = first_lane[sorted.thread[i]] + sorted.depth[i];
    setRange(sorted);
    endUnfinished(sorted);
    for (const message of messages) message.call = callAround(sorted, message.thread, message.depth, message.time);
    sorted.calls_before = sums(sorted.calls);
    sorted.failed_before = sums(sorted.failed);
    sorted.time_before = sums(sorted.end.map((end, i) =>
      sorted.name[i] === kMergedFunction ? sorted.time[i] : end - sorted.begin[i]));
    return sorted;
  }

  // Calls arrive in order of time, but merged ones are in chunks of their own.
  function sortLane(order, begin) {
    for (let i = 1; i < order.length; ++i) {
      if (begin[order[i]] < begin[order[i - 1]]) {
        order.sort((a, b) => begin[a] - begin[b]);
        return;
      }
    }
  }

  function setRange(calls) {
    let first = Infinity;
    let last = -Infinity;
    for (let i = 0; i < calls.count; ++i) {
      if (calls.begin[i] < first) first = calls.begin[i];
      if (calls.end[i] > last) last = calls.end[i];
    }
    for (const message of calls.messages) {
      first = Math.min(first, message.time);
      last = Math.max(last, message.time);
    }
    if (first > last) first = last = 0;
    calls.range = [first, Math.max(last, first + 1000)];
  }

  // An unfinished call in a finished one has ended with it. Another is drawn until the next one of its lane, or as long
  // as the one around it, or to the end of the trace. The lanes of a thread are in the order of their depths.
  function endUnfinished(calls) {
    for (let i = 0; i < calls.count; ++i) {
      if (!(calls.state[i] & kUnfinished)) continue;
      const around = callThatHas(calls, i);
      if (around !== -1 && !(calls.state[around] & kUnfinished)) continue;
      const is_last = i + 1 === calls.count || calls.lane[i + 1] !== calls.lane[i];
      const limit = around === -1 ? calls.range[1] : calls.end[around];
      calls.end[i] = Math.max(calls.begin[i], is_last ? limit : Math.min(limit, calls.begin[i + 1]));
    }
  }

  function sums(values) {
    const before = new Float64Array(values.length + 1);
    for (let i = 0; i < values.length; ++i) before[i + 1] = before[i] + values[i];
    return before;
  }

  // The first index in [from, to) whose value is at least `least`.
  function lowerBound(values, least, from, to) {
    while (from < to) {
      const middle = (from + to) >>> 1;
      if (values[middle] < least) from = middle + 1; else to = middle;
    }
    return from;
  }

  function callAt(calls, lane, time) {
    const from = calls.from[lane];
    const at = lowerBound(calls.end, time, from, calls.from[lane + 1]);
    return at < calls.from[lane + 1] && calls.begin[at] <= time ? at : -1;
  }

  function laneOfDepth(calls, thread, depth) {
    const lane = calls.first_lane[thread] + depth;
    return depth >= 0 && lane < calls.first_lane[thread + 1] ? lane : -1;
  }

  // What is closest around a time at this depth. Calls in merged ones are in no lane, so that it may be further up.
  function callAround(calls, thread, depth, time) {
    const lanes = calls.first_lane[thread + 1] - calls.first_lane[thread];
    for (let above = Math.min(depth, lanes) - 1; above >= 0; --above) {
      const at = callAt(calls, calls.first_lane[thread] + above, time);
      if (at !== -1) return at;
    }
    return -1;
  }

  // The call around another one. Of two that touch when that begins it is the later one.
  function callThatHas(calls, i) {
    let around = callAround(calls, calls.thread[i], calls.depth[i], calls.begin[i]);
    while (around !== -1 && around + 1 < calls.count && calls.lane[around + 1] === calls.lane[around] &&
           calls.end[around] === calls.begin[i] && calls.begin[around + 1] === calls.begin[i]) ++around;
    return around;
  }

  // ---- Texts ----

  // Control characters get their symbols; they could hide what surrounds them.
  function visible(text) {
    return text.replace(/[\u0000-\u0008\u000b-\u001f]/g, (c) => String.fromCharCode(0x2400 + c.charCodeAt(0)))
      .replace(/[\u007f-\u009f\u200e\u200f\u202a-\u202e\u2066-\u2069]/g, "\ufffd");
  }

  function nameOf(i) {
    return data.name[i] === kMergedFunction ? countOfCalls(data.calls[i])
                                            : visible(trace.functions[data.name[i]]);
  }

  const number = d3.format(",");
  const countOfCalls = (count) => `${number(count)} ${count === 1 ? "call" : "calls"}`;

  function duration(ns) {
    if (ns === null || ns === undefined) return "";
    const size = Math.abs(ns);
    const digits = (value) => String(Number(value.toPrecision(4)));
    if (size < 1e3) return `${digits(ns)} ns`;
    if (size < 1e6) return `${digits(ns / 1e3)} µs`;
    if (size < 1e9) return `${digits(ns / 1e6)} ms`;
    return `${Number((ns / 1e9).toFixed(size < 1e11 ? 3 : 0))} s`;
  }

  // The time since 1970 does not fit into a number.
  function moment(ns) {
    const since_1970 = BigInt(trace.start) + BigInt(Math.round(ns));
    return momentOf(since_1970);
  }

  function momentOf(since_1970) {
    const billion = 1000000000n;
    const rest = ((since_1970 % billion) + billion) % billion;
    const date = new Date(Number((since_1970 - rest) / 1000000n));
    if (Number.isNaN(date.getTime())) return `${since_1970} ns`;
    return date.toISOString().replace(/\.\d+Z$/, `.${String(rest).padStart(9, "0")}Z`);
  }

  function processName(process) {
    const [host, program, pid] = trace.processes[process];
    return visible(`${program} ${pid}${host ? ` on ${host}` : ""}`);
  }

  function resultOf(i) {
    const state = data.state[i];
    if (state & kUnfinished) return "unfinished";
    const code = data.code[i] === null ? "no code" : `code ${data.code[i]}`;
    if (state & kFailed) return `failed, ${code}`;
    return state & kUnknown ? `${code}, unknown whether it failed` : code;
  }

  // ---- Where the rows are ----

  function layOut(data) {
    const order = d3.range(trace.threads.length).sort((a, b) =>
      trace.threads[a][0] - trace.threads[b][0] || trace.threads[a][1] - trace.threads[b][1]);
    const laid = [];
    let top = 0;
    let process = -1;
    for (const thread of order) {
      if (trace.threads[thread][0] !== process) {
        process = trace.threads[thread][0];
        laid.push({top, process, height: kProcessHeight});
        top += kProcessHeight;
      }
      const lanes = data.first_lane[thread + 1] - data.first_lane[thread];
      const height = Math.max(lanes, 1) * kLaneHeight + kThreadGap;
      laid.push({top, thread, height});
      top += height;
    }
    const of_thread = new Array(trace.threads.length);
    for (const row of laid) if (row.thread !== undefined) of_thread[row.thread] = row;
    return {list: laid, tops: laid.map((row) => row.top), of_thread, height: top};
  }

  // ---- The view ----

  const canvas = byId("canvas");
  const context = canvas.getContext("2d");
  const scroller = byId("rows");
  let width = 0;
  let height = 0;

  const base = d3.scaleLinear().domain(data.range);
  const span = data.range[1] - data.range[0];
  let dragged_y = null;
  const zoom = d3.zoom()
    .scaleExtent([1, Math.min(1e12, Math.max(1, span / 50))])
    .filter((event) => {
      const used = d3.event || event;
      return !used.button && !(used.type === "wheel" && used.shiftKey);
    })
    .on("zoom", (event) => {
      const used = d3.event || event;  // the version 5 of D3, and later ones
      const source = used.sourceEvent;
      if (source && source.type === "mousemove") {
        if (dragged_y !== null) scroller.scrollTop -= source.clientY - dragged_y;
        dragged_y = source.clientY;
      }
      transform = used.transform;
      redraw();
    })
    .on("end", () => { dragged_y = null; });
  const zoomed = d3.select(canvas).call(zoom).on("dblclick.zoom", null);

  function resize() {
    width = scroller.clientWidth;
    height = scroller.clientHeight;
    const ratio = window.devicePixelRatio || 1;
    canvas.width = Math.round(width * ratio);
    canvas.height = Math.round(height * ratio);
    canvas.style.width = `${width}px`;
    canvas.style.height = `${height}px`;
    byId("spacer").style.height = `${Math.max(0, rows.height - height)}px`;
    context.setTransform(ratio, 0, 0, ratio, 0, 0);
    base.range([kGutter, width]);
    zoom.extent([[kGutter, 0], [width, height]])
      .translateExtent([[kGutter, -Infinity], [width, Infinity]]);
    redraw();
  }

  function readColours() {
    const style = getComputedStyle(document.documentElement);
    const value = (name) => style.getPropertyValue(`--${name}`).trim();
    colours = {};
    for (const name of ["paper", "ink", "faint", "line", "band", "accent", "failed", "failed-ink", "merged"]) {
      colours[name] = value(name);
    }
    colours.functions = trace.functions.map((_, i) =>
      `hsl(${Math.round(190 + i * 137.508) % 360} ${value("saturation")} ${value("lightness")})`);
    colours.hatching = hatching(colours.ink);
    redraw();
  }

  function hatching(ink) {
    const tile = document.createElement("canvas");
    tile.width = tile.height = 6;
    const on_tile = tile.getContext("2d");
    on_tile.strokeStyle = ink;
    on_tile.globalAlpha = .55;
    on_tile.beginPath();
    for (const shift of [-6, 0, 6]) {
      on_tile.moveTo(shift, 6);
      on_tile.lineTo(shift + 6, 0);
    }
    on_tile.stroke();
    return context.createPattern(tile, "repeat");
  }

  // ---- Drawing ----

  let is_drawing = false;
  function redraw() {
    if (is_drawing) return;
    is_drawing = true;
    requestAnimationFrame(() => {
      is_drawing = false;
      draw();
    });
  }

  let character = 0;
  function draw() {
    scale = transform.rescaleX(base);
    context.font = "11px ui-monospace, monospace";
    context.textBaseline = "middle";
    character = character || context.measureText("M").width;
    context.fillStyle = colours.paper;
    context.fillRect(0, 0, width, height);
    const scrolled = scroller.scrollTop;
    let row = Math.max(0, lowerBound(rows.tops, scrolled + 1, 0, rows.list.length) - 1);
    for (; row < rows.list.length && rows.list[row].top < scrolled + height; ++row) {
      const {top, thread, process, height: row_height} = rows.list[row];
      if (thread === undefined) drawProcess(process, top - scrolled);
      else drawThread(thread, top - scrolled, row_height);
    }
    drawSelection(scrolled);
    drawAxis();
  }

  function drawProcess(process, y) {
    context.fillStyle = colours.band;
    context.fillRect(0, y, width, kProcessHeight);
    context.fillStyle = colours.ink;
    context.fillText(processName(process), 6, y + kProcessHeight / 2);
  }

  function drawThread(thread, y, row_height) {
    context.save();
    context.beginPath();
    context.rect(kGutter, 0, width - kGutter, height);
    context.clip();
    const lanes = data.first_lane[thread + 1] - data.first_lane[thread];
    for (let depth = 0; depth < lanes; ++depth) {
      const lane_y = y + kThreadGap / 2 + depth * kLaneHeight;
      if (lane_y + kLaneHeight < 0) continue;
      if (lane_y > height) break;
      drawLane(data.first_lane[thread] + depth, lane_y);
    }
    context.restore();
    context.fillStyle = colours.faint;
    context.fillText(`thread ${trace.threads[thread][1]}`, 14, y + kThreadGap / 2 + kLaneHeight / 2);
    context.fillStyle = colours.line;
    context.fillRect(0, y + row_height - 1, width, 1);
    context.fillRect(kGutter - 1, y, 1, row_height);
  }

  function drawLane(lane, y) {
    const [view_begin, view_end] = scale.domain();
    const to = data.from[lane + 1];
    const per_ns = (width - kGutter) / (view_end - view_begin);
    const xOf = (time) => kGutter + (time - view_begin) * per_ns;
    let i = lowerBound(data.end, view_begin, data.from[lane], to);
    let run = null;
    const endRun = () => {
      if (run !== null) labelRun(run, y);
      run = null;
    };
    while (i < to && data.begin[i] <= view_end) {
      const x = xOf(data.begin[i]);
      const end = xOf(data.end[i]);
      if (end - x >= kCell && data.name[i] !== kMergedFunction) {
        endRun();
        drawCall(i, Math.max(x, kGutter - 8), Math.min(end, width + 8), y);
        ++i;
        continue;
      }
      // All that ends within the cell that begins here.
      const cell_end = view_begin + (Math.max(x, kGutter) - kGutter + kCell) / per_ns;
      const next = Math.max(i + 1, lowerBound(data.begin, cell_end, i + 1, to));
      const last = next - 1;
      const merged_to = last > i && xOf(data.end[last]) - xOf(data.begin[last]) >= kCell ? last : next;
      const cell_right = Math.max(x + 1, Math.min(xOf(data.end[merged_to - 1]), width + 8));
      if (run !== null && x - run.right > 1) endRun();
      run = run || {left: x, right: x, calls: 0, failed: 0};
      drawCell(i, merged_to, Math.max(x, kGutter - 8), cell_right, y);
      run.right = cell_right;
      run.calls += data.calls_before[merged_to] - data.calls_before[i];
      run.failed += data.failed_before[merged_to] - data.failed_before[i];
      i = merged_to;
    }
    endRun();
  }

  function isDim(from, to) {
    return matched !== null && matched_before[to] === matched_before[from];
  }

  function drawCall(i, x, end, y) {
    const state = data.state[i];
    const box = kLaneHeight - 2;
    const is_failed = (state & kFailed) !== 0;
    context.globalAlpha = isDim(i, i + 1) ? .25 : 1;
    context.fillStyle = is_failed ? colours.failed : colours.functions[data.name[i]];
    const shown = Math.max(1, end - x - (end - x > 4 ? 1 : 0));
    context.fillRect(x, y, shown, box);
    if (is_failed) {
      context.fillStyle = colours.hatching;
      context.fillRect(x, y, shown, box);
    }
    if (shown > 6 && state & kUnknown) {
      context.strokeStyle = colours.ink;
      context.setLineDash([3, 3]);
      context.strokeRect(x + .5, y + .5, shown - 1, box - 1);
      context.setLineDash([]);
    }
    if (state & kUnfinished) {
      context.fillStyle = colours.ink;
      context.fillRect(x, y, 1, box);
      for (let dot = 0; dot < box; dot += 4) context.fillRect(x + shown - 2, y + dot, 2, 2);
    }
    const mark = is_failed ? "✗ " : state & kUnfinished ? "… " : state & kUnknown ? "? " : "";
    label(mark + nameOf(i), Math.max(x, kGutter), end, y, is_failed);
    context.globalAlpha = 1;
  }

  function label(text, x, end, y, on_failed) {
    const fitting = Math.floor((end - x - 6) / character);
    if (fitting < 2) return;
    const shown = text.length > fitting ? `${text.slice(0, fitting - 1)}…` : text;
    if (on_failed) {  // hatching would cross the letters
      context.fillStyle = colours.failed;
      context.fillRect(x + 2, y + 2, shown.length * character + 2, kLaneHeight - 6);
    }
    context.fillStyle = on_failed ? colours["failed-ink"] : colours.ink;
    context.fillText(shown, x + 3, y + kLaneHeight / 2 - 1);
  }

  // Several calls, the darker the more of the time they take.
  function drawCell(from, to, x, end, y) {
    const [view_begin, view_end] = scale.domain();
    const cell_time = (end - x) * (view_end - view_begin) / (width - kGutter);
    const busy = Math.min(1, (data.time_before[to] - data.time_before[from]) / cell_time);
    const box = kLaneHeight - 2;
    context.globalAlpha = (isDim(from, to) ? .25 : 1) * (.35 + .65 * busy);
    context.fillStyle = to - from === 1 && data.name[from] !== kMergedFunction
      ? colours.functions[data.name[from]] : colours.merged;
    context.fillRect(x, y, end - x, box);
    if (data.failed_before[to] > data.failed_before[from]) {  // a notch at the bottom, too
      context.globalAlpha = isDim(from, to) ? .25 : 1;
      context.fillStyle = colours.failed;
      context.fillRect(x, y, Math.min(kCell, end - x), box);
      context.fillRect(x - 2, y + box - 4, Math.min(kCell, end - x) + 4, 4);
    }
    context.globalAlpha = 1;
  }

  function labelRun(run, y) {
    const x = Math.max(run.left, kGutter);
    const end = Math.min(run.right, width);
    const text = `${number(run.calls)} calls${run.failed ? `, ✗ ${number(run.failed)} failed` : ""}`;
    const needed = text.length * character + 6;
    if (run.calls < 2 || end - x < needed) return;
    context.fillStyle = colours.paper;
    context.fillRect(x + 2, y + 2, needed - 2, kLaneHeight - 6);
    context.fillStyle = colours.ink;
    context.fillText(text, x + 4, y + kLaneHeight / 2 - 1);
  }

  function drawSelection(scrolled) {
    if (selected === -1) return;
    const x = Math.max(scale(data.begin[selected]), kGutter - 8);
    const end = Math.min(scale(data.end[selected]), width + 8);
    if (end < kGutter || x > width) return;
    context.strokeStyle = colours.accent;
    context.lineWidth = 3;
    context.strokeRect(x - 1, yOf(selected) - scrolled - 1, Math.max(end - x, 2) + 2, kLaneHeight);
    context.lineWidth = 1;
  }

  function yOf(i) {
    return rows.of_thread[data.thread[i]].top + kThreadGap / 2 + data.depth[i] * kLaneHeight;
  }

  const axis = d3.select("#axis");
  const axis_group = axis.append("g").attr("transform", "translate(0,23)");
  const axis_note = axis.append("text").attr("x", 6).attr("y", 16);
  // With as many digits as times that differ by a step need.
  function exact(ns, step) {
    const size = Math.abs(ns);
    const [unit, name] = size < 1e3 ? [1, "ns"] : size < 1e6 ? [1e3, "µs"] : size < 1e9 ? [1e6, "ms"] : [1e9, "s"];
    const digits = Math.max(0, Math.ceil(Math.log10(unit / step)));
    return `${Number((ns / unit).toFixed(digits))} ${name}`;
  }

  function drawAxis() {
    const from_start = d3.scaleLinear()
      .domain(scale.domain().map((time) => time - data.range[0])).range([kGutter, width]);
    const count = Math.max(2, width / 130);
    const step = d3.tickStep(...from_start.domain(), count);
    axis_group.call(d3.axisTop(from_start).ticks(count).tickSizeOuter(0).tickFormat((ns) => exact(ns, step)));
    axis_note.text("since the start");
  }

  // ---- Selecting ----

  function select(i, how = {}) {
    selected = i;
    if (i !== -1) {
      if (how.is_shown !== false) bringIntoView(i, how.is_zoomed);
      byId("announcement").textContent =
        `${nameOf(i)}, ${resultOf(i)}, ${data.state[i] & kUnfinished ? "" : duration(data.end[i] - data.begin[i])}, ` +
        `depth ${data.depth[i]}, thread ${trace.threads[data.thread[i]][1]}`;
    }
    showDetails();
    redraw();
  }

  function bringIntoView(i, is_zoomed) {
    const y = yOf(i);
    if (y < scroller.scrollTop || y + kLaneHeight > scroller.scrollTop + height) {
      scroller.scrollTop = y - height / 3;
    }
    scale = transform.rescaleX(base);
    const x = scale(data.begin[i]);
    const end = scale(data.end[i]);
    const length = Math.max(data.end[i] - data.begin[i], span / 1e12, 1);
    if (is_zoomed && end - x < 60) zoomTo(i, span / (length * 8));
    else if (is_zoomed && end - x > width - kGutter) zoomTo(i, span / (length * 1.5));
    else if (end < kGutter || x > width) zoomTo(i, transform.k);
  }

  function zoomTo(i, factor) {
    const [least, most] = zoom.scaleExtent();
    const k = Math.min(most, Math.max(least, factor));
    const middle = base((data.begin[i] + data.end[i]) / 2);
    zoomed.call(zoom.transform, d3.zoomIdentity.translate((kGutter + width) / 2 - k * middle, 0).scale(k));
    zoomed.call(zoom.translateBy, 0, 0);  // keeps the view within the trace
  }

  // The index range of the calls at this place. A pixel may have many.
  function callsAtPixel(x, y) {
    const row = rows.list[lowerBound(rows.tops, y + 1, 0, rows.list.length) - 1];
    if (row === undefined || row.thread === undefined || x < kGutter) return null;
    const lane = laneOfDepth(data, row.thread, Math.floor((y - row.top - kThreadGap / 2) / kLaneHeight));
    if (lane === -1) return null;
    const to = data.from[lane + 1];
    const time = scale.invert(x);
    const exact = callAt(data, lane, time);
    if (exact !== -1 && scale(data.end[exact]) - scale(data.begin[exact]) >= kCell) return [exact, exact + 1];
    const from = lowerBound(data.end, scale.invert(x - 3), data.from[lane], to);
    const end = lowerBound(data.begin, scale.invert(x + 3), from, to);
    return from < end ? [from, end] : null;
  }

  // A failed call first, then the longest.
  function bestOf([from, to]) {
    let best = from;
    const has_failures = data.failed_before[to] > data.failed_before[from];
    for (let i = from; i < to; ++i) {
      if (has_failures && !data.failed[i]) continue;
      if (has_failures && !data.failed[best] || data.end[i] - data.begin[i] > data.end[best] - data.begin[best]) best = i;
    }
    return best;
  }

  function pixelOf(event) {
    const box = canvas.getBoundingClientRect();
    return [event.clientX - box.left, event.clientY - box.top + scroller.scrollTop];
  }

  canvas.addEventListener("click", (event) => {
    const place = callsAtPixel(...pixelOf(event));
    select(place === null ? -1 : bestOf(place), {is_shown: false});
  });

  const tip = byId("tip");
  canvas.addEventListener("pointermove", (event) => {
    const place = event.buttons === 0 ? callsAtPixel(...pixelOf(event)) : null;
    tip.hidden = place === null;
    if (place === null) return;
    const i = bestOf(place);
    const more = data.calls_before[place[1]] - data.calls_before[place[0]];
    tip.textContent = `${nameOf(i)}: ${duration(data.end[i] - data.begin[i])}, ${describe(i)}` +
      (more > 1 && data.name[i] !== kMergedFunction ? ` (one of ${number(more)} calls at this place)` : "");
    const box = byId("timeline").getBoundingClientRect();
    tip.style.left = `${Math.min(event.clientX - box.left + 12, box.width - 240)}px`;
    tip.style.top = `${event.clientY - box.top + 16}px`;
  });
  canvas.addEventListener("pointerleave", () => { tip.hidden = true; });

  function describe(i) {
    return data.name[i] === kMergedFunction ? `${number(data.failed[i])} failed` : resultOf(i);
  }

  // ---- The panel ----

  const parentOf = (i) => callThatHas(data, i);

  // The range of the calls that it makes itself.
  function childrenOf(i) {
    const lane = laneOfDepth(data, data.thread[i], data.depth[i] + 1);
    if (lane === -1) return [0, 0];
    const to = data.from[lane + 1];
    let from = lowerBound(data.begin, data.begin[i], data.from[lane], to);
    let end = from;
    while (end < to && data.end[end] <= data.end[i]) ++end;
    return [from, end];
  }

  function callButton(parent, i) {
    return parent.append("button").attr("type", "button")
      .text(`${data.state[i] & kFailed ? "✗ " : ""}${nameOf(i)}`)
      .on("click", () => {
        select(i, {is_zoomed: true});
        canvas.focus();
      });
  }

  function showDetails() {
    const i = selected;
    const details = d3.select("#details").html("");
    if (i === -1) {
      byId("panel-heading").textContent = "No call is selected";
      details.append("p").text("Click a call, or move to one with the arrow keys.");
      return;
    }
    byId("panel-heading").textContent = nameOf(i);
    const list = details.append("dl");
    const line = (term, text, kind) => {
      list.append("dt").text(term);
      return list.append("dd").attr("class", kind || null).text(text);
    };
    const is_merged = data.name[i] === kMergedFunction;
    const [from, to] = childrenOf(i);
    const own = data.end[i] - data.begin[i] - (data.time_before[to] - data.time_before[from]);
    if (is_merged) {
      line("Failed", number(data.failed[i]), data.failed[i] ? "failed" : null);
      if (data.inner[i]) line("Merged too", `${countOfCalls(data.inner[i])} in ${data.calls[i] === 1 ? "it" : "them"}`);
    } else {
      line("Result", `${data.state[i] & kFailed ? "✗ " : ""}${resultOf(i)}`, data.state[i] & kFailed ? "failed" : null);
    }
    if (data.state[i] & kNoEntry) {
      line("Entry", "not recorded");
      line("End", moment(data.end[i]));
    } else {
      line("Begin", moment(data.begin[i]));
      if (!(data.state[i] & kUnfinished)) {
        line(is_merged ? "From first to last" : "Duration", duration(data.end[i] - data.begin[i]));
        if (!is_merged) line("Own time", duration(own));
      }
    }
    line("Process", processName(trace.threads[data.thread[i]][0]));
    line("Thread", trace.threads[data.thread[i]][1]);
    const parent = parentOf(i);
    callButtonOrText(line("Called by", ""), parent);
    showMessages(details, i);
    showChildren(details, from, to);
  }

  function callButtonOrText(place, parent) {
    if (parent === -1) place.text("no recorded call"); else callButton(place, parent);
  }

  function showMessages(details, i) {
    const messages = data.messages.filter((message) => message.call === i);
    details.append("h4").text(`Messages (${number(messages.length)})`);
    const items = details.append("ul").selectAll("li").data(messages.slice(0, kMostListed)).enter().append("li");
    items.append("span").attr("class", "when")
      .text((message) => `+${duration(message.time - data.begin[i])}${message.is_error ? ", error" : ""}`);
    items.append("pre").attr("class", (message) => (message.is_error ? "failed" : null))
      .text((message) => visible(message.text.replace(/\n$/, "")));
    if (messages.length > kMostListed) details.append("p").text(`The first ${kMostListed} are shown.`);
  }

  function showChildren(details, from, to) {
    details.append("h4").text(`Calls in it (${number(data.calls_before[to] - data.calls_before[from])})`);
    const shown = d3.range(from, Math.min(to, from + kMostListed));
    const items = details.append("ul").selectAll("li").data(shown).enter().append("li");
    items.each(function (i) {
      callButton(d3.select(this), i);
      d3.select(this).append("span").attr("class", "when").text(` ${duration(data.end[i] - data.begin[i])}, ${describe(i)}`);
    });
    if (to - from > kMostListed) details.append("p").text(`The first ${kMostListed} are shown.`);
  }

  // ---- Search ----

  function search(typed) {
    const text = typed.trim().toLowerCase();
    matched = null;
    if (text !== "") {
      const is_name_matched = trace.functions.map((name) => name.toLowerCase().includes(text));
      const code = (/^(?:code[ :=]*)?(-?\d+)$/.exec(text) || [])[1];
      matched = new Uint8Array(data.count);
      for (let i = 0; i < data.count; ++i) {
        matched[i] = is_name_matched[data.name[i]] ||
          (code !== undefined && data.code[i] !== null && String(data.code[i]) === code) ? 1 : 0;
      }
      for (const message of data.messages) {
        if (message.call !== -1 && message.text.toLowerCase().includes(text)) matched[message.call] = 1;
      }
      matched_before = sums(matched);
    }
    const count = matched === null ? 0 : matched_before[data.count];
    byId("search-count").textContent = matched === null ? "" :
      (count === 1 ? "1 call matches" : `${number(count)} calls match`) +
      (has_merged ? "; merged calls are found only by their messages" : "");
    redraw();
  }

  // The next call in order of time, then of index, for which `isWanted` holds; -1 if there is none.
  function following(isWanted, direction) {
    const isAfter = (a, b) =>
      direction * (data.begin[a] - data.begin[b]) > 0 || (data.begin[a] === data.begin[b] && direction * (a - b) > 0);
    let best = -1;
    let first = -1;
    for (let i = 0; i < data.count; ++i) {
      if (!isWanted(i)) continue;
      if (first === -1 || isAfter(first, i)) first = i;
      if ((selected === -1 || isAfter(i, selected)) && (best === -1 || isAfter(best, i))) best = i;
    }
    return best !== -1 ? best : first;  // begins again
  }

  function goTo(isWanted, direction, none) {
    const found = following(isWanted, direction);
    if (found === -1) byId("announcement").textContent = none;
    else select(found, {is_zoomed: true});
  }

  const nextMatch = (direction) => goTo((i) => matched !== null && matched[i] === 1, direction, "No call matches");
  const nextFailed = (direction) => goTo((i) => data.failed[i] > 0, direction, "No call failed");

  let typing = 0;
  byId("search").addEventListener("input", (event) => {
    clearTimeout(typing);
    typing = setTimeout(() => search(event.target.value), 100);
  });
  byId("search-form").addEventListener("submit", (event) => {
    event.preventDefault();
    clearTimeout(typing);
    search(byId("search").value);
    nextMatch(1);
  });
  byId("previous").addEventListener("click", () => nextMatch(-1));

  // ---- Buttons and keys ----

  const zoomBy = (factor) => {
    let middle = (kGutter + width) / 2;
    if (selected !== -1 && scale !== null) {
      const x = scale((data.begin[selected] + data.end[selected]) / 2);
      if (x > kGutter && x < width) middle = x;
    }
    zoomed.call(zoom.scaleBy, factor, [middle, 0]);
  };
  const zoomAll = () => zoomed.call(zoom.transform, d3.zoomIdentity);
  const moveBy = (part) => zoomed.call(zoom.translateBy, part * (width - kGutter) / transform.k, 0);
  byId("zoom-in").addEventListener("click", () => zoomBy(2));
  byId("zoom-out").addEventListener("click", () => zoomBy(.5));
  byId("zoom-all").addEventListener("click", zoomAll);
  byId("next-failed").addEventListener("click", () => nextFailed(1));

  // The call after or before in the lane, the caller or the first called one.
  function neighbour(key) {
    if (selected === -1) return data.count === 0 ? -1 : following(() => true, 1);
    const lane = data.lane[selected];
    if (key === "ArrowRight") return selected + 1 < data.from[lane + 1] ? selected + 1 : -1;
    if (key === "ArrowLeft") return selected > data.from[lane] ? selected - 1 : -1;
    if (key === "ArrowUp") return parentOf(selected);
    const [from, to] = childrenOf(selected);
    return from < to ? from : -1;
  }

  const edge = (key) => ({ArrowRight: "No call after this one", ArrowLeft: "No call before this one",
                          ArrowUp: "No recorded call around this one", ArrowDown: "No call in this one"})[key];

  canvas.addEventListener("keydown", (event) => {
    if (event.ctrlKey || event.altKey || event.metaKey) return;
    const actions = {
      "+": () => zoomBy(2), "=": () => zoomBy(2), "-": () => zoomBy(.5), "0": zoomAll,
      "a": () => moveBy(.25), "d": () => moveBy(-.25),
      "z": () => { if (selected !== -1) zoomTo(selected, span / (Math.max(1, data.end[selected] - data.begin[selected]) * 1.5)); },
      "f": () => nextFailed(1), "F": () => nextFailed(-1),
      "n": () => nextMatch(1), "N": () => nextMatch(-1),
      "PageDown": () => { scroller.scrollTop += height * .9; },
      "PageUp": () => { scroller.scrollTop -= height * .9; },
      "Enter": () => byId("panel-heading").focus(),
      "/": () => byId("search").focus(),
    };
    if (event.key.startsWith("Arrow")) {
      const found = neighbour(event.key);
      if (found === -1) byId("announcement").textContent = edge(event.key);
      else select(found, {is_zoomed: event.key === "ArrowDown"});
    } else if (Object.hasOwn(actions, event.key)) {
      actions[event.key]();
    } else {
      return;
    }
    event.preventDefault();
  });
  byId("panel").addEventListener("keydown", (event) => {
    if (event.key === "Escape") canvas.focus();
  });
  byId("search").addEventListener("keydown", (event) => {
    if (event.key === "Escape") canvas.focus();
  });
  canvas.addEventListener("wheel", (event) => {
    if (!event.shiftKey) return;
    scroller.scrollTop += event.deltaY || event.deltaX;
    event.preventDefault();
  }, {passive: false});
  scroller.addEventListener("scroll", redraw);

  // ---- The summary ----

  const columns = [
    {title: "Function", value: (row) => row.function, text: (row) => visible(row.function), is_text: true},
    {title: "Calls", value: (row) => row.calls, text: (row) => number(row.calls)},
    {title: "Failures", value: failures, text: failureText},
    {title: "Unfinished", value: (row) => row.unfinished, text: (row) => number(row.unfinished)},
    ...["total", "own", "mean", "median", "p99", "longest"].map((key) => ({
      title: {total: "Total", own: "Own", mean: "Mean", median: "Median", p99: "99 %", longest: "Longest"}[key],
      value: (row) => (row[key] === null ? -1 : row[key]), text: (row) => duration(row[key])})),
    {title: "Longest at", value: (row) => row.longest_at || "", text: (row) => longestAt(row), is_text: true},
  ];

  function failures(row) {
    return d3.sum(Object.values(row.failures));
  }

  function failureText(row) {
    const codes = Object.entries(row.failures).map(([code, count]) => `${code}: ${number(count)}`);
    if (codes.length === 0) return row.unknown ? `? ${number(row.unknown)} unknown` : "0";
    const shown = codes.slice(0, 4).join(", ") + (codes.length > 4 ? ", …" : "");
    return `✗ ${number(failures(row))} (${shown})`;
  }

  function longestAt(row) {
    const value = row.longest_at;
    if (value === null || value === undefined || value === "") return "";
    return /^-?\d+$/.test(String(value)) ? momentOf(BigInt(value)) : String(value);
  }

  let sorted_by = 4;
  let is_descending = true;

  function showSummary() {
    const headings = d3.select("#summary thead tr").selectAll("th").data(columns);
    const added = headings.enter().append("th").attr("scope", "col");
    added.append("button").attr("type", "button").text((column) => column.title);
    added.select("button").on("click", function () {
      const at = columns.indexOf(d3.select(this).datum());
      is_descending = at === sorted_by ? !is_descending : !columns[at].is_text;
      sorted_by = at;
      showSummary();
    });
    d3.selectAll("#summary thead th").attr("aria-sort", (_, i) =>
      i !== sorted_by ? null : is_descending ? "descending" : "ascending");
    const {value} = columns[sorted_by];
    const compare = is_descending ? d3.descending : d3.ascending;
    const list = [...trace.summary].sort((a, b) => compare(value(a), value(b)) || d3.ascending(a.function, b.function));
    const body = d3.select("#summary tbody").html("");
    for (const row of list) {
      const line = body.append("tr");
      columns.forEach((column, i) => {
        const cell = line.append("td").attr("class", i === 2 && failures(row) ? "failed" : null);
        if (i > 0) cell.text(column.text(row));
        else cell.append("button").attr("type", "button").text(column.text(row)).on("click", () => searchFor(row.function));
      });
    }
  }

  function searchFor(text) {
    byId("search").value = text;
    search(text);
    byId("timeline-heading").scrollIntoView({block: "nearest"});
    canvas.focus({preventScroll: true});
    nextMatch(1);
  }

  function showOverview() {
    const calls = data.calls_before[data.count] + d3.sum(data.inner);
    const failed = data.failed_before[data.count];
    byId("overview").textContent =
      `${number(trace.processes.length)} ${trace.processes.length === 1 ? "process" : "processes"}, ` +
      `${number(trace.threads.length)} ${trace.threads.length === 1 ? "thread" : "threads"}, ` +
      `${countOfCalls(calls)}, ${number(failed)} failed, ` +
      `${number(data.messages.length)} ${data.messages.length === 1 ? "message" : "messages"}; ` +
      `${duration(data.range[1] - data.range[0])} from ${moment(data.range[0])}`;
    d3.select("#notes").selectAll("li").data(trace.notes).enter().append("li").text(visible);
  }

  showOverview();
  showSummary();
  readColours();
  new ResizeObserver(resize).observe(scroller);
  window.matchMedia("(prefers-color-scheme: dark)").addEventListener("change", readColours);
  resize();
  requestAnimationFrame(() => requestAnimationFrame(() => document.documentElement.setAttribute("data-ready", "")));
})();
