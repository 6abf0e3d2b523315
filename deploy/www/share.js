// Visitor page of a sharing link: share.html#<link id> (or ?link=<link id>).
//
// The page opens a visitor session (VELA.Sharing.Visitor "open", which sets
// the HttpOnly cookie "sharing_sid"; a visitor who holds one keeps it), asks
// for the password when the link answers 473, then lists the shared folder
// through VELA.Sample.Share "list" with the link in the header
// "X-Vela-Sharing". Files are plain links that name the link in the query
// ("_sharing_id"), so the browser's own download sends the cookie and byte
// ranges like any other request. Whatever the server names is shown as text.
"use strict";

(function () {
  const ENTRY = "/webapi/entry.cgi";
  const SHARE = `${ENTRY}?api=VELA.Sample.Share&version=1`;

  const MESSAGES = {
    470: "There is no such link, or it has been withdrawn.",
    471: "This link has expired: ask its owner for a new one.",
    472: "This link has been used as often as allowed: ask its owner for a new one.",
    473: "Wrong password.",
    474: "Too many wrong passwords from your address: try again later.",
    122: "There is no such link.",
    123: "This link is no longer valid.",
    124: "Your visit has ended: open the link again.",
    125: "Your visit has ended: open the link again.",
    127: "This link can only be used from the address that opened it.",
    1002: "This item is no longer there.",
    1003: "There is no folder to show behind this link.",
  };

  const el = (id) => document.getElementById(id);
  let link = "";
  let path = "";  // the folder shown, relative to the shared one

  function showError(text) {
    el("error").textContent = text;
    el("error").hidden = text === "";
  }

  // Resolves to the answer's "data"; rejects with an Error carrying `code`.
  async function callApi(url, init) {
    const reply = await fetch(url, Object.assign({ credentials: "same-origin" }, init));
    let answer;
    try {
      answer = await reply.json();
    } catch (e) {
      throw new Error(`The server sent no answer (HTTP ${reply.status}).`);
    }
    if (!answer || answer.success !== true) {
      const code = answer && answer.error ? answer.error.code : undefined;
      const error = new Error(MESSAGES[code] || `The server refused the request (error ${code}).`);
      error.code = code;
      throw error;
    }
    return answer.data;
  }

  function linkFromUrl() {
    const fromQuery = new URLSearchParams(location.search).get("link");
    const id = fromQuery !== null ? fromQuery : location.hash.slice(1);
    return /^[A-Za-z0-9_-]{22}$/.test(id) ? id : "";
  }

  function formatSize(bytes) {
    const units = ["bytes", "KiB", "MiB", "GiB", "TiB"];
    let i = 0;
    for (; bytes >= 1024 && i < units.length - 1; i++) {
      bytes /= 1024;
    }
    return i === 0 ? `${bytes} bytes` : `${bytes.toFixed(1)} ${units[i]}`;
  }

  function downloadUrl(file) {
    return `${SHARE}&method=download&path=${encodeURIComponent(file)}&_sharing_id=${encodeURIComponent(link)}`;
  }

  async function list(folder) {
    let url = `${SHARE}&method=list`;
    if (folder !== "") {
      url += `&path=${encodeURIComponent(folder)}`;
    }
    const data = await callApi(url, { headers: { "X-Vela-Sharing": link } });
    path = folder;
    el("where").textContent = `/${folder}`;
    el("up").hidden = folder === "";
    const items = [];
    for (const file of data.files) {
      const item = document.createElement("li");
      const full = folder === "" ? file.name : `${folder}/${file.name}`;
      let name;
      if (file.type === "dir") {
        name = document.createElement("button");
        name.type = "button";
        name.textContent = `${file.name}/`;
        name.addEventListener("click", () => enter(full));
      } else if (file.type === "file") {
        name = document.createElement("a");
        name.href = downloadUrl(full);
        name.download = file.name;
        name.textContent = file.name;
      } else {
        continue;
      }
      const size = document.createElement("span");
      size.textContent = file.type === "file" ? formatSize(file.size) : "";
      item.append(name, size);
      items.push(item);
    }
    if (data.truncated) {
      const more = document.createElement("li");
      more.textContent = "(more entries than can be shown)";
      items.push(more);
    }
    el("files").replaceChildren(...items);
    el("browser").hidden = false;
  }

  async function enter(folder) {
    showError("");
    try {
      await list(folder);
    } catch (e) {
      showError(e.message);
    }
  }

  // Opens the visitor session, with the password typed when `withPassword`.
  async function open(withPassword) {
    showError("");
    let body = `link=${encodeURIComponent(link)}`;
    if (withPassword) {
      body += `&password=${encodeURIComponent(el("password").value)}`;
    }
    el("open").disabled = true;
    try {
      const data = await callApi(`${ENTRY}?api=VELA.Sharing.Visitor&version=1&method=open`, {
        method: "POST",
        headers: { "Content-Type": "application/x-www-form-urlencoded" },
        body,
      });
      el("password").value = "";
      el("unlock").hidden = true;
      el("title").textContent = data.name;
      await list("");
    } catch (e) {
      if (e.code === 473) {
        el("unlock").hidden = false;
        el("password").focus();
      }
      if (e.code !== 473 || withPassword) {
        showError(e.message);
      }
    } finally {
      el("open").disabled = false;
    }
  }

  document.addEventListener("DOMContentLoaded", () => {
    link = linkFromUrl();
    el("unlock").addEventListener("submit", (event) => {
      event.preventDefault();
      open(true);
    });
    el("up").addEventListener("click", () => enter(path.includes("/") ? path.slice(0, path.lastIndexOf("/")) : ""));
    if (link === "") {
      showError("This address does not name a sharing link.");
    } else {
      open(false);
    }
  });
})();
