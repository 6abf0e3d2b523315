// Drives deploy/www/login.html in headless Chromium: a wrong password shows
// the sign-in error; the right one signs in (encrypted credentials, HttpOnly
// session cookie, token header) and the page shows the sample's whoami
// answer for the user.
//
// usage: node login.test.js BASE_URL ACCOUNT PASSWORD
// Exit 0 when every check passed, 1 otherwise. CHROMIUM names the browser
// (default /usr/bin/chromium).
"use strict";

const { STEP_MS, check, args, watch, main } = require("./harness");

const [base, account, password] = args("BASE_URL", "ACCOUNT", "PASSWORD");

// Waits until the sign-in is over: the whoami answer or the error shown.
// Their texts ("" for the one not shown).
async function outcome(page) {
  const shown = await page.waitForFunction(() => {
    const text = (id) => (document.getElementById(id).closest("[hidden]") ? "" : document.getElementById(id).textContent.trim());
    const o = { user: text("user"), error: text("error") };
    return o.user !== "" || o.error !== "" ? o : null;
  }, null, { timeout: STEP_MS });
  return shown.jsonValue();
}

async function signIn(page, passwd) {
  await page.fill("#account", account);
  await page.fill("#passwd", passwd);
  await page.click("#submit");
}

main("login", async (browser) => {
  const context = await browser.newContext();
  const page = watch(await context.newPage());
  // The bodies of the login calls, to show that no password left in clear.
  const loginBodies = [];
  page.on("request", (r) => {
    if (/[?&]method=login(&|$)/.test(r.url())) {
      loginBodies.push(r.postData() || "");
    }
  });

  const reply = await page.goto(`${base}/login.html`);
  check(reply && reply.status() === 200, `login.html: HTTP ${reply && reply.status()}`);

  // A wrong password: the error, no session.
  await signIn(page, `x${password}`);
  const wrong = await outcome(page);
  check(/wrong account or password/i.test(wrong.error), `wrong password shows ${JSON.stringify(wrong)}`);
  check(wrong.user === "", "wrong password: the whoami answer is shown");
  const before = await context.cookies(base);
  check(!before.some((c) => c.name === "id"), "wrong password: a session cookie was set");

  // The right one: whoami answers for the user, the error is gone.
  await signIn(page, password);
  const right = await outcome(page);
  check(right.user === `Signed in as ${account}` && right.error === "",
        `after the login the page shows ${JSON.stringify(right)}`);
  if (right.user === "") {
    return;  // nothing signed in: the rest cannot be checked
  }
  check(loginBodies.length === 2, `${loginBodies.length} login calls, expected 2`);
  for (const body of loginBodies) {
    check(/^__cIpHeRtExT=[A-Za-z0-9%]+$/.test(body) && !body.includes(encodeURIComponent(password)),
          `a login body is not only the cipher text: ${body.slice(0, 120)}`);
  }
  const answer = JSON.parse(await page.textContent("#answer"));
  check(answer.user === account, `whoami answered ${JSON.stringify(answer)}`);

  // The session cookie is out of reach of scripts and of other sites.
  const cookie = (await context.cookies(base)).find((c) => c.name === "id");
  check(cookie && cookie.httpOnly && cookie.sameSite === "Strict" && cookie.path === "/",
        `session cookie ${JSON.stringify(cookie)}`);
  const scriptCookies = await page.evaluate(() => document.cookie);
  check(!/(^|;\s*)id=/.test(scriptCookies), `document.cookie shows the session: "${scriptCookies}"`);

  // Sign out: whoami is refused again.
  await page.click("#logout");
  await page.waitForSelector("#whoami", { state: "hidden" });
  const status = await page.evaluate(async () => {
    const r = await fetch("/webapi/entry.cgi?api=VELA.Sample&version=1&method=whoami");
    return (await r.json()).error;
  });
  check(status && status.code === 119, `whoami after signing out: ${JSON.stringify(status)}`);
});
