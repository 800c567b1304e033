// GET /: the one page icd serves, compiled in (no files, no CDN). Every text
// from the server is placed with textContent, never parsed as HTML.
//
// Stable hooks for scripts and tests: #tree (the nodes, each an element
// .node[data-path] with a .state-ok/-warning/-critical/-unknown class, and
// .rollup-warning/-critical where the health roll-up is asserted), #alerts
// (one .alert[data-path] per asserted alert), #status ("N events received").
#pragma once

namespace icd {

inline char const kPage[] = R"ICDPAGE(<!DOCTYPE html>
<html lang="en">
<head>
<meta charset="utf-8">
<meta name="viewport" content="width=device-width, initial-scale=1">
<title>icd</title>
<style>
body { font: 14px/1.4 system-ui, sans-serif; margin: 1em 2em; color: #222; }
h1 { font-size: 1.3em; } h2 { font-size: 1.1em; margin-top: 1.5em; }
#status { color: #555; }
ul { list-style: none; padding-left: 1.2em; margin: 0; }
#tree > ul { padding-left: 0; }
.node > .row { padding: 1px 4px; border-left: 4px solid #ccc; margin: 1px 0; }
.row .path { color: #888; font-family: monospace; font-size: 0.85em; margin-left: 0.6em; }
.row .reading { font-weight: 600; margin-left: 0.4em; }
.state-ok > .row { border-color: #2a2; }
.state-warning > .row { border-color: #e90; background: #fff6e0; }
.state-critical > .row { border-color: #d22; background: #ffe8e8; }
.state-unknown > .row { border-color: #999; }
.rollup-warning > .row { border-color: #e90; background: #fff6e0; }
.rollup-critical > .row { border-color: #d22; background: #ffe8e8; }
table { border-collapse: collapse; } td, th { padding: 2px 8px; text-align: left; border-bottom: 1px solid #eee; }
.alert.sev-critical, .alert.sev-fatal { background: #ffe8e8; } .alert.sev-warning { background: #fff6e0; }
</style>
</head>
<body>
<h1>icd: <span id="host">this server</span></h1>
<p id="status">0 events received</p>
<h2>Asserted alerts</h2>
<table id="alerts"><thead><tr><th>severity</th><th>class</th><th>node</th><th>path</th><th>message</th></tr></thead><tbody></tbody></table>
<h2>Hardware</h2>
<div id="tree"></div>
<script>
"use strict";
let events = 0, pending = null, rollups = [];
function el(tag, cls, text) {
  const e = document.createElement(tag);
  if (cls) e.className = cls;
  if (text !== undefined) e.textContent = text;
  return e;
}
function stateClass(s) {
  if (s === null || s === undefined) return "";
  if (s === "ok" || s === "no link") return "state-ok";
  if (s === "warning") return "state-warning";
  if (s === "critical" || s === "offline" || s === "absent") return "state-critical";
  return "state-unknown";
}
function nodeItem(n) {
  const li = el("li", "node " + stateClass(n.state));
  li.dataset.path = n.path;
  const row = el("div", "row");
  row.appendChild(el("span", "name", n.typeName + " " + n.instance + ": " + n.description));
  if (n.reading) row.appendChild(el("span", "reading", n.reading.value + (n.reading.unit ? " " + n.reading.unit : "")));
  if (n.state) row.appendChild(el("span", "state", " (" + n.state + ")"));
  row.appendChild(el("span", "path", n.path));
  li.appendChild(row);
  if (n.children && n.children.length) {
    const ul = el("ul");
    n.children.forEach(c => ul.appendChild(nodeItem(c)));
    li.appendChild(ul);
  }
  return li;
}
async function loadTree() {
  const doc = await (await fetch("api/v1/nodes")).json();
  const ul = el("ul");
  doc.nodes.forEach(n => ul.appendChild(nodeItem(n)));
  const tree = document.getElementById("tree");
  tree.replaceChildren(ul);
  tree.dataset.count = doc.count;
  paintRollups();
  if (doc.nodes.length && doc.nodes[0].typeName === "ROOT") document.getElementById("host").textContent = doc.nodes[0].description;
}
async function loadAlerts() {
  const doc = await (await fetch("api/v1/alerts")).json();
  const body = document.querySelector("#alerts tbody");
  body.replaceChildren();
  doc.alerts.forEach(a => {
    const tr = el("tr", "alert sev-" + a.severityName);
    tr.dataset.path = a.paths.join(",");
    const node = a.nodes.map(n => n ? n.typeName + " " + n.instance + ": " + n.description : "(gone)").join(", ");
    [a.severityName, a.className, node, a.paths.join(", "), a.message].forEach(t => tr.appendChild(el("td", "", t)));
    body.appendChild(tr);
  });
  document.getElementById("alerts").dataset.count = doc.count;
  rollups = doc.alerts.filter(a => a.className === "health-rollup");
  paintRollups();
}
// The chassis has no state of its own: its row shows the health roll-up.
function paintRollups() {
  document.querySelectorAll(".rollup-warning, .rollup-critical").forEach(li => li.classList.remove("rollup-warning", "rollup-critical"));
  rollups.forEach(a => a.paths.forEach(p => {
    const li = document.querySelector('#tree li[data-path="' + CSS.escape(p) + '"]');
    if (li && (a.severityName === "warning" || a.severityName === "critical")) li.classList.add("rollup-" + a.severityName);
  }));
}
function refresh() {
  if (pending) return;
  pending = setTimeout(() => { pending = null; loadTree().catch(() => {}); loadAlerts().catch(() => {}); }, 300);
}
// ?events=N stops listening after N events, so that a headless browser
// waiting for the network to go quiet can take the page as it then is.
const stopAfter = Number(new URLSearchParams(location.search).get("events")) || 0;
function listen() {
  const source = new EventSource("api/v1/events");
  source.addEventListener("alert", () => {
    events += 1;
    document.getElementById("status").textContent = events + " events received";
    if (stopAfter && events >= stopAfter) source.close();
    refresh();
  });
}
Promise.all([loadTree(), loadAlerts()]).catch(e => { document.getElementById("status").textContent = "cannot load: " + e; }).then(listen);
</script>
</body>
</html>
)ICDPAGE";

} // namespace icd
