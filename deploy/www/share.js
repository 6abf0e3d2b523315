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
  const { el, make, showError } = vela;

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

  let link = "";
  let path = "";  // the folder shown, relative to the shared one

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
    return vela.url("VELA.Sample.Share", "download", { path: file, _sharing_id: link });
  }

  async function list(folder) {
    const data = await vela.call("VELA.Sample.Share", "list", {
      params: folder !== "" ? { path: folder } : {},
      headers: { "X-Vela-Sharing": link },
      messages: MESSAGES,
    });
    path = folder;
    el("where").textContent = `/${folder}`;
    el("up").hidden = folder === "";
    const items = [];
    for (const file of data.files) {
      const item = make("li");
      const full = folder === "" ? file.name : `${folder}/${file.name}`;
      let name;
      if (file.type === "dir") {
        name = make("button", `${file.name}/`);
        name.type = "button";
        name.addEventListener("click", () => enter(full));
      } else if (file.type === "file") {
        name = make("a", file.name);
        name.href = downloadUrl(full);
        name.download = file.name;
      } else {
        continue;
      }
      item.append(name, make("span", file.type === "file" ? formatSize(file.size) : ""));
      items.push(item);
    }
    if (data.truncated) {
      items.push(make("li", "(more entries than can be shown)"));
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
      const data = await vela.call("VELA.Sharing.Visitor", "open", { body, messages: MESSAGES });
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
