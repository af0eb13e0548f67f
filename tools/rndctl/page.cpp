#include "tools/rndctl/page.h"

namespace {

// Every text of the farm goes in with textContent (the `el` helper): a job
// comment holding markup shows its characters.  Nothing is fetched from
// outside this server.
const char kPage[] = R"PAGE(<!DOCTYPE html>
<html lang="en"><head><meta charset="utf-8">
<meta name="viewport" content="width=device-width, initial-scale=1">
<title>render farm</title>
<style>
body{font:14px/1.35 system-ui,sans-serif;margin:0;background:#15171a;color:#dde}
header{padding:8px 14px;background:#22262b;display:flex;gap:16px;align-items:baseline}
header h1{font-size:16px;margin:0}
a{color:#8cf}
main{padding:10px 14px}
table{border-collapse:collapse;width:100%;margin-bottom:18px}
th,td{padding:3px 6px;border-bottom:1px solid #2c3036;text-align:left;vertical-align:middle}
th{color:#99a;font-weight:normal}
.bar{width:120px;height:10px;background:#333;border-radius:3px;overflow:hidden}
.bar div{height:100%;background:#4a4}
.failed,.aborted,.down,.locked{color:#f77}
.finished,.up{color:#7d7}
.thumb{height:36px;background:#000}
.strip img{height:90px;margin:2px;background:#000}
pre{background:#0d0f11;padding:6px;max-height:240px;overflow:auto;white-space:pre-wrap}
#problem{color:#f77}
pre:empty{display:none}
</style></head>
<body>
<header><h1><a href="#">render farm</a></h1><span id="problem"></span><span id="seen"></span></header>
<main id="view"></main>
<script>
"use strict";
let generation = -1, route = "";
function el(tag, text, cls) {
  const e = document.createElement(tag);
  if (text !== undefined && text !== null) e.textContent = String(text);
  if (cls) e.className = cls;
  return e;
}
function row(cells) {
  const tr = document.createElement("tr");
  for (const c of cells) {
    const td = document.createElement("td");
    if (c instanceof Node) td.appendChild(c); else td.textContent = c === undefined ? "" : String(c);
    tr.appendChild(td);
  }
  return tr;
}
function table(heads, id) {
  const t = el("table"); if (id) t.id = id;
  const tr = document.createElement("tr");
  for (const h of heads) tr.appendChild(el("th", h));
  t.appendChild(tr);
  return t;
}
function bar(percent) {
  const p = Math.max(0, Math.min(100, Number(percent) || 0));
  const b = el("div", null, "bar"), f = el("div");
  b.setAttribute("role", "progressbar");
  b.setAttribute("aria-valuenow", p.toFixed(1));
  f.style.width = p.toFixed(1) + "%";
  b.appendChild(f);
  return b;
}
function link(text, href) { const a = el("a", text); a.href = href; return a; }
function stateClass(s) { return String(s).split(" ")[0]; }
async function get(path) {
  const r = await fetch(path, {cache: "no-store"});
  if (!r.ok) throw new Error(path + ": " + r.status);
  return r.json();
}
function jobsTable(jobs) {
  const t = table(["", "#", "name", "user", "state", "progress", "frames", "pri", "run",
                   "schedule", "hosts", "comment"], "jobs");
  for (const j of jobs) {
    const img = el("img", null, "thumb");
    img.loading = "lazy"; img.alt = "";
    img.src = "/api/jobs/" + j.index + "/thumb?g=" + generation;
    img.onerror = () => { img.style.visibility = "hidden"; };
    const tr = row([img, j.index, link(j.name, "#job/" + j.index), j.user, el("span", j.state, stateClass(j.state)),
                    bar(j.percent), j.doneframes + "/" + j.totalframes, j.priority, j.run,
                    j.schedule, j.hosts.length ? j.hosts.join(",") : "all", j.comment]);
    tr.dataset.job = j.index;
    t.appendChild(tr);
  }
  return t;
}
function hostsTable(hosts) {
  const t = table(["name", "host", "lock", "now", "daemon", "proc", "frames", "renders", "schedule", "log"], "hosts");
  for (const h of hosts) {
    const renders = (h.status || []).map(s => s.job + " " + s.status + " " + s.output).join("\n") || h.renders;
    t.appendChild(row([h.name, h.host, h.lock, el("span", h.locked_now ? "locked" : "free", h.locked_now ? "locked" : ""),
                       el("span", h.alive ? "up" : "down", h.alive ? "up" : "down"), h.processors,
                       h.max_frames, el("pre", renders), h.schedule, el("pre", (h.log || []).join("\n"))]));
  }
  return t;
}
async function showFarm(view) {
  const [jobs, hosts] = await Promise.all([get("/api/jobs"), get("/api/hosts")]);
  view.replaceChildren(el("h2", "jobs"), jobsTable(jobs), el("h2", "hosts"), hostsTable(hosts));
}
async function showJob(view, index) {
  const j = await get("/api/jobs/" + index);
  const t = table(["id", "frames", "status", "host", "at", "retries"], "tasks");
  for (const k of j.tasks) t.appendChild(row([k.id, k.start + "-" + k.end, k.status, k.host, k.current, k.retries]));
  const strip = el("div", null, "strip");
  for (const f of j.images) {
    const img = el("img"); img.alt = f; img.title = f;
    img.src = "/api/jobs/" + index + "/frames/" + encodeURIComponent(f) + "?g=" + generation;
    strip.appendChild(img);
  }
  const parts = [el("h2", "job " + j.index + " " + j.name), bar(j.percent),
                 el("p", j.state + "  " + j.doneframes + "/" + j.totalframes + " frames  run " + j.run +
                    (j.schedule ? " (" + j.schedule + ")" : "")),
                 el("p", j.comment), el("h3", "frames"), strip, el("h3", "tasks"), t];
  for (const o of j.outputs) parts.push(el("h3", "task " + o.task + " output"), el("pre", o.tail));
  parts.push(el("h3", "log"), el("pre", j.log));
  view.replaceChildren(...parts);
}
async function draw() {
  const view = document.getElementById("view");
  const m = /^#job\/(\d+)$/.exec(location.hash);
  try {
    if (m) await showJob(view, m[1]); else await showFarm(view);
    document.getElementById("seen").textContent = "updated " + new Date().toLocaleTimeString();
  } catch (e) {
    view.replaceChildren(el("p", String(e.message || e)));
  }
}
async function poll() {
  try {
    const c = await get("/api/changed?since=" + generation);
    document.getElementById("problem").textContent = c.problem || "";
    if (c.generation !== generation || location.hash !== route) {
      generation = c.generation; route = location.hash;
      await draw();
    }
  } catch (e) {
    document.getElementById("problem").textContent = "server unreachable";
  }
  setTimeout(poll, 500);
}
window.addEventListener("hashchange", () => { route = ""; });
poll();
</script></body></html>
)PAGE";

}  // namespace

const char* Page_html() { return kPage; }
