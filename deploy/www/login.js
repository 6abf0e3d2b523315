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
  const { el, showError, TOKEN_KEY } = vela;

  // Messages for the error codes of VELA.Auth and of the session check; any
  // other code is shown with its number.
  const MESSAGES = Object.assign({
    400: "Wrong account or password.",
    401: "The password has expired; change it before signing in.",
    402: "The server could not complete the sign-in.",
    407: "Too many failed attempts: sign-in is blocked for a while.",
  }, vela.ACCESS_MESSAGES);

  let token = "";

  // The page to go back to: a plain page name of this folder, nothing else.
  function nextPage() {
    const next = new URLSearchParams(location.search).get("next") || "";
    return /^[a-z]{1,32}\.html$/.test(next) ? next : "";
  }

  // Calls one method; `body` (a string) makes it a form POST. Resolves to
  // the answer's "data"; a refused sign-in says how long it stays blocked
  // when the server tells.
  async function callApi(api, method, body) {
    try {
      return await vela.call(api, method, { body, headers: token ? { "X-Vela-Token": token } : {}, messages: MESSAGES });
    } catch (e) {
      if (e.code === 407 && e.detail && Number.isInteger(e.detail.waitSeconds)) {
        e.message += ` Try again in ${Math.ceil(e.detail.waitSeconds / 60)} minute(s).`;
      }
      throw e;
    }
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
    showError("");
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
    showError("");
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
