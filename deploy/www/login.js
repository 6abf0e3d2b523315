// Sign-in page of the web API.
//
// The credentials never travel in clear text: the page fetches the server's
// public key (VELA.Auth "key", SPKI PEM), encrypts the query string
// "account=...&passwd=..." with RSA-OAEP (SHA-256 for the digest and MGF1)
// through WebCrypto, and posts it as the one parameter "__cIpHeRtExT"
// (base64, percent-encoded). The server answers with the session cookie "id"
// (HttpOnly, so this script never sees it) and the anti-forgery token, which
// every later call sends in the header "X-Vela-Token". The token is kept in
// this tab's sessionStorage ("vela.token") for the other pages of the site;
// login.html?next=<page>.html goes back to that page after the sign-in.
"use strict";

(function () {
  const ENTRY = "/webapi/entry.cgi";

  // Messages for the error codes of VELA.Auth and of the session check; any
  // other code is shown with its number.
  const MESSAGES = {
    400: "Wrong account or password.",
    401: "The password has expired; change it before signing in.",
    402: "The server could not complete the sign-in.",
    407: "Too many failed attempts: sign-in is blocked for a while.",
    105: "You are not allowed to do this.",
    106: "Your session has timed out; sign in again.",
    119: "You are not signed in.",
  };

  const el = (id) => document.getElementById(id);
  const TOKEN_KEY = "vela.token";
  let token = "";

  // The page to go back to: a plain page name of this folder, nothing else.
  function nextPage() {
    const next = new URLSearchParams(location.search).get("next") || "";
    return /^[a-z]{1,32}\.html$/.test(next) ? next : "";
  }

  function showError(text) {
    el("error").textContent = text;
    el("error").hidden = false;
  }

  function clearError() {
    el("error").textContent = "";
    el("error").hidden = true;
  }

  // An API error as an exception carrying the code the server answered.
  class ApiError extends Error {
    constructor(code, detail) {
      let message = MESSAGES[code] || `The server refused the request (error ${code}).`;
      if (code === 407 && detail && Number.isInteger(detail.waitSeconds)) {
        message += ` Try again in ${Math.ceil(detail.waitSeconds / 60)} minute(s).`;
      }
      super(message);
      this.code = code;
      this.detail = detail;
    }
  }

  // Calls one method; `body` (a string) makes it a form POST. Resolves to
  // the answer's "data", rejects with ApiError for {"success": false}.
  async function callApi(api, method, body) {
    const url = `${ENTRY}?api=${encodeURIComponent(api)}&version=1&method=${encodeURIComponent(method)}`;
    const init = { method: body === undefined ? "GET" : "POST", headers: {}, credentials: "same-origin" };
    if (body !== undefined) {
      init.headers["Content-Type"] = "application/x-www-form-urlencoded";
      init.body = body;
    }
    if (token) {
      init.headers["X-Vela-Token"] = token;
    }
    const reply = await fetch(url, init);
    let answer;
    try {
      answer = await reply.json();
    } catch (e) {
      throw new Error(`The server sent no answer (HTTP ${reply.status}).`);
    }
    if (!answer || answer.success !== true) {
      const error = (answer && answer.error) || {};
      throw new ApiError(error.code, error.errors);
    }
    return answer.data;
  }

  // The DER bytes of the first PEM block of `pem`.
  function pemToDer(pem) {
    const body = pem.replace(/-----(BEGIN|END) [A-Z ]+-----/g, "").replace(/\s+/g, "");
    const raw = atob(body);
    const der = new Uint8Array(raw.length);
    for (let i = 0; i < raw.length; i++) {
      der[i] = raw.charCodeAt(i);
    }
    return der.buffer;
  }

  function toBase64(buffer) {
    const bytes = new Uint8Array(buffer);
    let raw = "";
    for (let i = 0; i < bytes.length; i++) {
      raw += String.fromCharCode(bytes[i]);
    }
    return btoa(raw);
  }

  // `text` encrypted for the server: base64 of the RSA-OAEP cipher text.
  async function encryptForServer(text) {
    if (!window.crypto || !window.crypto.subtle) {
      throw new Error("This browser cannot encrypt here: open the page over HTTPS.");
    }
    const { publicKey } = await callApi("VELA.Auth", "key");
    const key = await crypto.subtle.importKey("spki", pemToDer(publicKey),
                                              { name: "RSA-OAEP", hash: "SHA-256" }, false, ["encrypt"]);
    const cipher = await crypto.subtle.encrypt({ name: "RSA-OAEP" }, key, new TextEncoder().encode(text));
    return toBase64(cipher);
  }

  async function showWhoAmI() {
    const data = await callApi("VELA.Sample", "whoami");
    el("user").textContent = `Signed in as ${data.user}`;
    el("answer").textContent = JSON.stringify(data, null, 2);
    el("whoami").hidden = false;
  }

  async function signIn(event) {
    event.preventDefault();
    clearError();
    el("whoami").hidden = true;
    el("submit").disabled = true;
    try {
      const account = el("account").value;
      const passwd = el("passwd").value;
      if (!account || !passwd) {
        throw new Error("Enter the account and the password.");
      }
      token = "";
      sessionStorage.removeItem(TOKEN_KEY);
      const plain = `account=${encodeURIComponent(account)}&passwd=${encodeURIComponent(passwd)}`;
      const cipher = await encryptForServer(plain);
      const login = await callApi("VELA.Auth", "login", `__cIpHeRtExT=${encodeURIComponent(cipher)}`);
      token = login.token;
      sessionStorage.setItem(TOKEN_KEY, token);
      el("passwd").value = "";
      if (nextPage() !== "") {
        location.replace(nextPage());
        return;
      }
      await showWhoAmI();
    } catch (e) {
      showError(e.message);
    } finally {
      el("submit").disabled = false;
    }
  }

  async function signOut() {
    clearError();
    try {
      await callApi("VELA.Auth", "logout");
    } catch (e) {
      showError(e.message);
    }
    token = "";
    sessionStorage.removeItem(TOKEN_KEY);
    el("whoami").hidden = true;
  }

  document.addEventListener("DOMContentLoaded", () => {
    el("login").addEventListener("submit", signIn);
    el("logout").addEventListener("click", signOut);
  });
})();
