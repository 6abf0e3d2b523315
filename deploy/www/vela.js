// What the static pages share: the call of the web API with the shape of its
// errors, and small DOM helpers. A page loads it before its own script (both
// deferred, so they run in that order); it defines the one global `vela`.
"use strict";

const vela = (() => {
  const ENTRY = "/webapi/entry.cgi";

  // An answer other than {"success": true}: the code the server named
  // (undefined when none), its "errors" detail, and the page's text for the
  // code or one that names the number.
  class ApiError extends Error {
    constructor(code, detail, messages) {
      super(messages && Object.prototype.hasOwnProperty.call(messages, code) ? messages[code]
        : `The server refused the request (error ${code}).`);
      this.code = code;
      this.detail = detail;
    }
  }

  // The entry's address for `method` of version 1 of `api`, with the further
  // query parameters of the object `params`, encoded.
  function url(api, method, params) {
    let address = `${ENTRY}?api=${encodeURIComponent(api)}&version=1&method=${encodeURIComponent(method)}`;
    for (const [name, value] of Object.entries(params || {})) {
      address += `&${encodeURIComponent(name)}=${encodeURIComponent(value)}`;
    }
    return address;
  }

  // Calls `method` of `api` with this site's cookies. `options`: body (a
  // form-encoded string makes it a POST, else a GET), params (see url()),
  // headers, cache (fetch's cache mode), messages (texts by error code).
  // Resolves to the answer's "data"; rejects with an Error when the body is
  // not JSON and with an ApiError when success is not true.
  async function call(api, method, options = {}) {
    const init = { method: options.body === undefined ? "GET" : "POST", headers: Object.assign({}, options.headers),
                   credentials: "same-origin" };
    if (options.cache) {
      init.cache = options.cache;
    }
    if (options.body !== undefined) {
      init.headers["Content-Type"] = "application/x-www-form-urlencoded";
      init.body = options.body;
    }
    const reply = await fetch(url(api, method, options.params), init);
    let answer;
    try {
      answer = await reply.json();
    } catch (e) {
      throw new Error(`The server sent no answer (HTTP ${reply.status}).`);
    }
    if (!answer || answer.success !== true) {
      const error = (answer && answer.error) || {};
      throw new ApiError(error.code, error.errors, options.messages);
    }
    return answer.data;
  }

  const el = (id) => document.getElementById(id);

  // A new `tag` element holding `text` as text, of the class `className`.
  function make(tag, text, className) {
    const node = document.createElement(tag);
    if (text !== undefined) {
      node.textContent = text;
    }
    if (className) {
      node.className = className;
    }
    return node;
  }

  // The page's #error line shows `text`; "" hides it.
  function showError(text) {
    el("error").textContent = text;
    el("error").hidden = text === "";
  }

  return Object.freeze({
    // Where the sign-in page keeps the anti-forgery token in this tab's
    // sessionStorage for the other pages.
    TOKEN_KEY: "vela.token",
    // Texts of the codes of the session and permission checks.
    ACCESS_MESSAGES: Object.freeze({
      105: "You are not allowed to do this.",
      106: "Your session has timed out; sign in again.",
      119: "You are not signed in.",
    }),
    url,
    call,
    el,
    make,
    showError,
  });
})();
