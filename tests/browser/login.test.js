// Drives deploy/www/login.html in headless Chromium: a wrong password shows
// the sign-in error; the right one signs in (encrypted credentials, HttpOnly
// session cookie, token header) and the page shows the sample's whoami
// answer for the user.
//
// usage: node login.test.js BASE_URL ACCOUNT PASSWORD
// Exit 0 when every check passed, 1 otherwise. CHROMIUM names the browser
// (default /usr/bin/chromium).
"use strict";

const { chromium } = require("playwright-core");

const [base, account, password] = process.argv.slice(2);
if (!base || !account || !password) {
  console.error("usage: node login.test.js BASE_URL ACCOUNT PASSWORD");
  process.exit(2);
}
// Bounded waits: a slow machine gets time, a broken page an answer.
const STEP_MS = 60000;

let failures = 0;
// What the page loaded and logged, printed when a check failed.
const pageLog = [];

function check(ok, message) {
  if (!ok) {
    console.log(`FAIL: ${message}`);
    failures++;
  }
}

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

async function run() {
  const browser = await chromium.launch({
    executablePath: process.env.CHROMIUM || "/usr/bin/chromium",
    args: ["--no-sandbox"],
    timeout: STEP_MS,
  });
  try {
    const context = await browser.newContext();
    const page = await context.newPage();
    page.setDefaultTimeout(STEP_MS);
    page.on("console", (m) => pageLog.push(`console.${m.type()}: ${m.text()}`));
    page.on("pageerror", (e) => pageLog.push(`page error: ${e.message}`));
    page.on("response", (r) => pageLog.push(`${r.status()} ${r.request().method()} ${r.url()}`));
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
  } finally {
    await browser.close();
  }
}

run().catch((e) => check(false, e.stack || e)).then(() => {
  if (failures !== 0) {
    console.log(`---- what the page did\n${pageLog.join("\n")}\n${failures} check(s) failed`);
  } else {
    console.log("browser login checks passed");
  }
  process.exit(failures === 0 ? 0 : 1);
});
