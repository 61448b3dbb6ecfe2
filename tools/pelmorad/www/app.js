// Polls /api/status and fills the page; no framework, no build step.
"use strict";

const PERIOD_MS = 3000;
const $ = (id) => document.getElementById(id);

function formatUptime(seconds) {
  let s = Math.floor(seconds);
  const d = Math.floor(s / 86400); s -= d * 86400;
  const h = Math.floor(s / 3600); s -= h * 3600;
  const m = Math.floor(s / 60); s -= m * 60;
  return (d ? d + "d " : "") + (d || h ? h + "h " : "") + (d || h || m ? m + "m " : "") + s + "s";
}

// Replaces a table body's rows; each row is a list of [text, className].
function fillTable(table, rows) {
  const body = table.tBodies[0];
  const fresh = document.createElement("tbody");
  for (const row of rows) {
    const tr = document.createElement("tr");
    for (const [text, cls] of row) {
      const td = document.createElement("td");
      td.textContent = text;
      if (cls) td.className = cls;
      tr.appendChild(td);
    }
    fresh.appendChild(tr);
  }
  table.replaceChild(fresh, body);
}

function filterCounters(counters) {
  const text = $("filter").value.trim();
  if (!text) return counters;
  let pattern;
  try { pattern = new RegExp(text, "i"); } catch (e) { return counters; }
  return counters.filter((c) => pattern.test(c.name));
}

// One row per work queue of the pool, from its counters.
function workQueues(counters) {
  const queues = new Map();
  const pattern = /^\/ThreadPool\/Pelmora\/WorkQueue\/([^/]+)\/(\w+)$/;
  for (const c of counters) {
    const m = pattern.exec(c.name);
    if (!m) continue;
    if (!queues.has(m[1])) queues.set(m[1], {});
    queues.get(m[1])[m[2]] = c.value;
  }
  const cell = (v) => [v === undefined ? "–" : v.toLocaleString("en-US"), "num"];
  return [...queues].map(([name, q]) => [[name.replace(/^Default|Queue$/g, "")],
    cell(q.currentConcurrency ?? q.CurrentConcurrency), cell(q.QueueSize), cell(q.TotalExecionCount)]);
}

function show(status) {
  const state = $("state");
  state.textContent = status.state;
  state.className = "badge " + status.state;
  document.title = "pelmorad · " + status.state;
  $("version").textContent = status.version;
  $("uptime").textContent = formatUptime(status.uptimeSeconds);
  $("pid").textContent = status.pid;
  $("connections").textContent = status.connections;
  $("stateDir").textContent = status.stateDir;
  $("configFile").textContent = status.configFile || "compiled-in defaults";
  const pool = status.pool || {};
  $("poolThreads").textContent = pool.minThreads + " to " + pool.maxThreads;
  $("poolRatio").textContent = pool.reservationRatio;
  fillTable($("queues"), workQueues(status.counters));
  const threadRows = [];
  for (const t of status.threads) {
    for (const text of t.states) threadRows.push([[String(t.thread)], [text]]);
  }
  fillTable($("threads"), threadRows);
  fillTable($("counters"), filterCounters(status.counters).map(
    (c) => [[c.name], [c.type], [c.value.toLocaleString("en-US"), "num"]]));
  const log = $("log");
  const atBottom = log.scrollTop + log.clientHeight >= log.scrollHeight - 4;
  log.textContent = status.log.join("\n");
  if (atBottom) log.scrollTop = log.scrollHeight;
  $("updated").textContent = "updated " + new Date().toLocaleTimeString();
}

let last = null;
async function refresh() {
  try {
    const response = await fetch("/api/status", { cache: "no-store" });
    if (!response.ok) throw new Error("HTTP " + response.status);
    last = await response.json();
    show(last);
  } catch (e) {
    const state = $("state");
    state.textContent = "unreachable";
    state.className = "badge down";
  } finally {
    setTimeout(refresh, PERIOD_MS);
  }
}

$("period").textContent = PERIOD_MS / 1000;
$("filter").addEventListener("input", () => { if (last) show(last); });
refresh();
