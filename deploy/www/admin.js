// Status page for administrators: API usage, tasks, sessions, blocked
// sign-ins and the APIs the caller may call, from VELA.Admin.
//
// The session is the one login.html opened: the HttpOnly cookie "id" goes
// with every call, and the anti-forgery token login.js kept in this tab's
// sessionStorage goes in the header "X-Vela-Token". Without a token, or
// when the server no longer knows the session, the page sends the user to
// the sign-in page, which comes back here. Everything the server names is
// inserted as text.
"use strict";

(function () {
  const { el, make, showError, TOKEN_KEY } = vela;
  const SIGN_IN = "login.html?next=admin.html";
  const TASK_REFRESH_MS = 3000;
  // The refresh pauses when nobody used the page for this long. The task
  // list is also read without keeping the session alive ("allowTimeout"),
  // so an open tab alone never keeps it from timing out.
  const IDLE_PAUSE_MS = 10 * 60 * 1000;
  const MAX_BARS = 20;
  const SVG_NS = "http://www.w3.org/2000/svg";

  const MESSAGES = Object.assign({
    480: "That session has already ended.",
    481: "The server could not complete the call.",
  }, vela.ACCESS_MESSAGES);
  // Codes that mean the session is gone or unusable from here.
  const SIGNED_OUT = new Set([106, 107, 119, 150]);

  const token = sessionStorage.getItem(TOKEN_KEY) || "";
  let taskTimer = 0;
  let taskBusy = false;
  let lastActive = Date.now();

  function signInAgain() {
    sessionStorage.removeItem(TOKEN_KEY);
    location.replace(SIGN_IN);
  }

  // Calls one VELA.Admin (or other) method; `body` (a string) makes it a
  // form POST. Resolves to the answer's "data"; a gone session leaves the
  // page for the sign-in page.
  async function callApi(api, method, body) {
    try {
      const data = await vela.call(api, method, { body, headers: { "X-Vela-Token": token }, cache: "no-store",
                                                  messages: MESSAGES });
      return data || {};
    } catch (e) {
      if (SIGNED_OUT.has(e.code)) {
        signInAgain();
      }
      throw e;
    }
  }

  // ---- Small helpers. Values from the server are checked before use.

  const isCount = (v) => Number.isInteger(v) && v >= 0;
  const asList = (v) => (Array.isArray(v) ? v : []);
  const asText = (v) => (typeof v === "string" ? v : "");

  function when(epoch) {
    return isCount(epoch) ? new Date(epoch * 1000).toLocaleString() : "\u2014";
  }

  function svg(tag, attributes, text) {
    const node = document.createElementNS(SVG_NS, tag);
    for (const [name, value] of Object.entries(attributes)) {
      node.setAttribute(name, String(value));
    }
    if (text !== undefined) {
      node.textContent = text;
    }
    return node;
  }

  // The status line of section `id`: "" hides it.
  function status(id, text, isError) {
    const line = el(id).querySelector(".status");
    line.textContent = text;
    line.classList.toggle("error", Boolean(isError));
    line.hidden = text === "";
  }

  function showAdminOnly() {
    clearInterval(taskTimer);
    el("panels").hidden = true;
    el("refresh").hidden = true;
    el("adminonly").hidden = false;
  }

  // A refusal (105) of an administrators' method: the server refuses an
  // unknown session the same way, so "apis", open to every signed-in user,
  // tells a gone session (back to the sign-in page) from a user who is no
  // administrator.
  async function refused() {
    try {
      await callApi("VELA.Admin", "apis");
    } catch (e) {
      if (e.code === 105) {
        signInAgain();
      }
      return;
    }
    showAdminOnly();
  }

  // Runs `load` for section `id`: its failure is shown in the section.
  async function section(id, load) {
    try {
      await load();
    } catch (e) {
      if (e.code === 105) {
        await refused();
      } else if (!SIGNED_OUT.has(e.code)) {
        status(id, e.message, true);
      }
    }
  }

  // ---- Usage: a horizontal bar chart of the most called methods.

  function drawUsage(counts) {
    const chart = el("usage-chart");
    const rows = counts.slice(0, MAX_BARS);
    const labelWidth = 300;
    const barSpace = 320;
    const rowHeight = 24;
    const max = Math.max(1, ...rows.map((c) => c.count));
    const parts = [];
    rows.forEach((c, i) => {
      const y = i * rowHeight;
      const label = `${c.api} v${c.version} ${c.method}`;
      const shown = label.length > 44 ? `${label.slice(0, 43)}\u2026` : label;
      const width = Math.max(1, Math.round((c.count / max) * barSpace));
      const bar = svg("g", { class: "bar" });
      bar.append(svg("title", {}, `${label}: ${c.count} call(s)`),
                 svg("text", { class: "label", x: labelWidth - 8, y: y + 16 }, shown),
                 svg("rect", { x: labelWidth, y: y + 4, width, height: rowHeight - 8 }),
                 svg("text", { class: "count", x: labelWidth + width + 6, y: y + 16 }, String(c.count)));
      parts.push(bar);
    });
    const height = rows.length * rowHeight;
    const total = labelWidth + barSpace + 80;
    chart.setAttribute("viewBox", `0 0 ${total} ${height}`);
    chart.setAttribute("width", String(total));
    chart.setAttribute("height", String(height));
    chart.replaceChildren(...parts);
    el("usage-box").hidden = rows.length === 0;
  }

  async function loadUsage() {
    const data = await callApi("VELA.Admin", "usage");
    if (data.enabled !== true) {
      el("usage-box").hidden = true;
      status("usage", "Usage collection is off: calls are not counted on this server.");
      return;
    }
    const counts = asList(data.counts).filter((c) => c && isCount(c.count) && isCount(c.version))
      .map((c) => ({ api: asText(c.api), version: c.version, method: asText(c.method), count: c.count }))
      .sort((a, b) => b.count - a.count);
    drawUsage(counts);
    if (counts.length === 0) {
      status("usage", "No calls counted yet.");
    } else if (counts.length > MAX_BARS) {
      status("usage", `The ${MAX_BARS} most called of ${counts.length} methods.`);
    } else {
      status("usage", "");
    }
  }

  // ---- Tasks, with their progress; refreshed while the page is shown.

  function taskRow(task) {
    const row = make("tr");
    const state = asText(task.state);
    row.dataset.id = asText(task.id);
    row.className = `task ${state === "running" ? "running" : ""}`;
    const bar = make("td");
    if (state === "running" || isCount(task.progress)) {
      const progress = make("progress");
      progress.max = 100;
      if (isCount(task.progress)) {
        progress.value = Math.min(task.progress, 100);
        progress.textContent = `${progress.value}%`;
        bar.append(progress, make("span", ` ${progress.value}%`, "percent"));
      } else {
        bar.append(progress);  // no value: the bar shows the task runs
      }
    }
    row.append(make("td", asText(task.id), "id"), make("td", asText(task.owner)),
               make("td", `${asText(task.api)} ${asText(task.method)}`), make("td", state, "state"), bar,
               make("td", when(task.created)));
    return row;
  }

  async function loadTasks() {
    const tasks = asList((await callApi("VELA.Admin", "tasks")).tasks).filter((t) => t && typeof t === "object");
    // Running ones first, newest first within each state.
    tasks.sort((a, b) => (a.state === "running" ? 0 : 1) - (b.state === "running" ? 0 : 1) ||
                         (isCount(b.created) ? b.created : 0) - (isCount(a.created) ? a.created : 0));
    const table = el("tasks").querySelector("table");
    table.tBodies[0].replaceChildren(...tasks.map(taskRow));
    table.hidden = tasks.length === 0;
    const running = tasks.filter((t) => t.state === "running").length;
    status("tasks", tasks.length === 0 ? "No tasks." : `${running} running, ${tasks.length - running} ended.`);
  }

  async function refreshTasks() {
    if (taskBusy || document.hidden) {
      return;
    }
    if (Date.now() - lastActive > IDLE_PAUSE_MS) {
      status("tasks", "Refreshing paused while the page is not used: press Refresh.");
      return;
    }
    taskBusy = true;
    try {
      await section("tasks", loadTasks);
    } finally {
      taskBusy = false;
    }
  }

  // ---- Sessions, each with a revoke button.

  async function revoke(session, button) {
    if (session.current &&
        !confirm("This is your own session: revoking it signs you out of this page. Revoke it?")) {
      return;
    }
    button.disabled = true;
    try {
      await callApi("VELA.Admin", "revoke", `id=${encodeURIComponent(session.id)}`);
      if (session.current) {
        signInAgain();
        return;
      }
      await loadSessions();
      status("sessions", `The session of ${session.user} from ${session.address || "any address"} is revoked.`);
    } catch (e) {
      button.disabled = false;
      if (e.code === 105) {
        await refused();
      } else if (!SIGNED_OUT.has(e.code)) {
        status("sessions", e.message, true);
      }
    }
  }

  function sessionRow(session) {
    const row = make("tr");
    row.dataset.id = session.id;
    const user = make("td", session.user, "user");
    if (session.current) {
      row.classList.add("current");
      user.append(make("span", " (this session)", "mark"));
    }
    const button = make("button", "Revoke", "revoke");
    button.type = "button";
    button.addEventListener("click", () => revoke(session, button));
    const cell = make("td");
    cell.append(button);
    row.append(user, make("td", session.address || "any"), make("td", when(session.created)),
               make("td", when(session.lastUsed)), cell);
    return row;
  }

  async function loadSessions() {
    const sessions = asList((await callApi("VELA.Admin", "sessions")).sessions)
      .filter((s) => s && typeof s.id === "string" && s.id !== "")
      .map((s) => ({ id: s.id, user: asText(s.user), address: asText(s.address), created: s.created,
                     lastUsed: s.lastUsed, current: s.current === true }));
    const table = el("sessions").querySelector("table");
    table.tBodies[0].replaceChildren(...sessions.map(sessionRow));
    table.hidden = sessions.length === 0;
    status("sessions", sessions.length === 0 ? "No sessions." : "");
  }

  // ---- Addresses and accounts the login guard blocks.

  function blockedItems(list, key) {
    const items = asList(list).filter((b) => b && typeof b[key] === "string").map((b) => {
      const item = make("li");
      item.append(make("span", b[key], "who"),
                  make("span", ` \u2014 ${isCount(b.failures) ? b.failures : "?"} failure(s), until ${when(b.until)}`));
      return item;
    });
    return items.length !== 0 ? items : [make("li", "None.", "none")];
  }

  async function loadBlocked() {
    const data = await callApi("VELA.Admin", "blocked");
    el("blocked-addresses").replaceChildren(...blockedItems(data.addresses, "address"));
    el("blocked-accounts").replaceChildren(...blockedItems(data.accounts, "account"));
    status("blocked", "");
  }

  // ---- The APIs the caller may call; true when they include VELA.Admin's
  // administrators' methods.

  async function loadApis() {
    const apis = asList((await callApi("VELA.Admin", "apis")).apis).filter((a) => a && typeof a.api === "string");
    let admin = false;
    const items = [];
    for (const a of apis) {
      const methods = a.methods && typeof a.methods === "object" ? a.methods : {};
      for (const [version, names] of Object.entries(methods)) {
        const list = asList(names).filter((n) => typeof n === "string");
        if (a.api === "VELA.Admin" && list.includes("usage")) {
          admin = true;
        }
        const item = make("li");
        item.append(make("span", `${a.api} v${version}`, "api"), make("span", ` ${list.join(", ")}`));
        items.push(item);
      }
    }
    el("apis").querySelector("ul").replaceChildren(...items);
    status("apis", items.length === 0 ? "None." : "");
    el("apis").hidden = false;
    return admin;
  }

  async function loadAll() {
    showError("");
    await Promise.all([section("usage", loadUsage), refreshTasks(), section("sessions", loadSessions),
                       section("blocked", loadBlocked)]);
  }

  async function start() {
    let admin = false;
    try {
      admin = await loadApis();
    } catch (e) {
      if (e.code === 105) {
        signInAgain();  // "apis" is open to every signed-in user
      } else if (!SIGNED_OUT.has(e.code)) {
        showError(e.message);
      }
      return;
    }
    if (!admin) {
      showAdminOnly();
      return;
    }
    el("panels").hidden = false;
    el("refresh").hidden = false;
    await loadAll();
    if (el("adminonly").hidden) {
      taskTimer = setInterval(refreshTasks, TASK_REFRESH_MS);
    }
  }

  async function signOut() {
    try {
      await callApi("VELA.Auth", "logout", "");
    } catch (e) {
      // Signed out anyway: the token is dropped below.
    }
    signInAgain();
  }

  document.addEventListener("DOMContentLoaded", () => {
    if (token === "") {
      signInAgain();
      return;
    }
    el("logout").addEventListener("click", signOut);
    el("refresh").addEventListener("click", loadAll);
    for (const kind of ["pointerdown", "keydown", "wheel"]) {
      document.addEventListener(kind, () => { lastActive = Date.now(); }, { passive: true });
    }
    start();
  });
})();
