// Drives deploy/www/admin.html in headless Chromium. Without a session the
// page sends the visitor to the sign-in page, which comes back to it. An
// administrator then sees the usage chart with the calls run.sh made, the
// running checksum task with its progress bar (refreshed), the sessions
// with their own marked, the address run.sh blocked and the APIs they may
// call; revoking the second session (made with velaadm) ends it on the
// server, revoking their own asks first and then signs them out. An ordinary user gets the
// administrators-only notice and nothing broken.
//
// With usage collection turned off in INFO_FILE (the root's velainfo.conf)
// the page says so instead of drawing.
//
// usage: node admin.test.js BASE_URL ADMIN ADMIN_PASSWORD USER USER_PASSWORD SECOND_SID TASK_ID BLOCKED_ADDRESS
//        INFO_FILE
// Exit 0 when every check passed, 1 otherwise. CHROMIUM names the browser
// (default /usr/bin/chromium).
"use strict";

const crypto = require("crypto");
const fs = require("fs");
const { STEP_MS, pageLog, check, args, watch, main } = require("./harness");

const [base, admin, adminPass, user, userPass, secondSid, taskId, blocked, infoFile] =
  args("BASE_URL", "ADMIN", "ADMIN_PASSWORD", "USER", "USER_PASSWORD", "SECOND_SID", "TASK_ID", "BLOCKED_ADDRESS",
       "INFO_FILE");

// whoami with the session `sid`, outside the browser: the answer's error
// code, 0 on success.
async function whoamiCode(sid) {
  const reply = await fetch(`${base}/webapi/entry.cgi?api=VELA.Sample&version=1&method=whoami`,
                            { headers: { Cookie: `id=${sid}` } });
  const answer = await reply.json();
  return answer.success === true ? 0 : answer.error && answer.error.code;
}

// A page of a fresh browser context, its doings logged; `errors` collects
// its script errors.
async function newPage(browser, errors) {
  const context = await browser.newContext();
  return watch(await context.newPage(), errors);
}

// Opens the status page without a session, is sent to the sign-in page and
// signs in there; back on the status page.
async function signInThroughPage(page, account, passwd) {
  await page.goto(`${base}/admin.html`);
  await page.waitForURL(/\/login\.html\?next=admin\.html$/);
  await page.fill("#account", account);
  await page.fill("#passwd", passwd);
  await page.click("#submit");
  await page.waitForURL(/\/admin\.html$/);
}

// What the page settled on: "panels", "adminonly" or the error it shows.
async function settled(page) {
  const shown = await page.waitForFunction(() => {
    const visible = (id) => !document.getElementById(id).hidden;
    return visible("panels") ? "panels" : visible("adminonly") ? "adminonly"
      : visible("error") ? `error: ${document.getElementById("error").textContent}` : null;
  });
  return shown.jsonValue();
}

async function checkUsage(page) {
  await page.waitForSelector("#usage-chart .bar");
  const bars = await page.$$eval("#usage-chart .bar", (gs) => gs.map((g) => ({
    title: g.querySelector("title").textContent,
    count: g.querySelector(".count").textContent,
    width: Number(g.querySelector("rect").getAttribute("width")),
  })));
  const whoami = bars.find((b) => b.title.startsWith("VELA.Sample v1 whoami:"));
  check(whoami && Number(whoami.count) >= 3 && whoami.width > 0, `no bar of 3 or more whoami calls: ${JSON.stringify(bars)}`);
  const counts = bars.map((b) => Number(b.count));
  check(counts.every((c, i) => i === 0 || counts[i - 1] >= c), `bars not by count: ${counts}`);
  const widest = Math.max(...bars.map((b) => b.width));
  check(bars.every((b) => b.width <= widest) && bars[0].width === widest, "the first bar is not the longest");
  check(await page.isHidden("#usage .status") || !/off/.test(await page.textContent("#usage .status")),
        "usage collection is said to be off");
}

async function checkTask(page) {
  const row = `#tasks tr[data-id="${taskId}"]`;
  await page.waitForSelector(`${row} progress`);
  const task = await page.$eval(row, (r) => ({
    state: r.querySelector(".state").textContent,
    progress: r.querySelector("progress").getAttribute("value"),
    text: r.textContent,
  }));
  check(task.state === "running" && Number(task.progress) >= 0 && /nobody/.test(task.text) &&
        /VELA\.Sample checksum/.test(task.text), `the task's row: ${JSON.stringify(task)}`);
  // The list is fetched again on its own.
  const calls = () => pageLog.filter((l) => /method=tasks(&|$)/.test(l) && /^200 /.test(l)).length;
  const before = calls();
  const deadline = Date.now() + STEP_MS;
  while (calls() <= before && Date.now() < deadline) {
    await page.waitForTimeout(250);
  }
  check(calls() > before, "the task list is not refreshed");
}

async function checkSessions(page) {
  const handle = crypto.createHash("sha256").update(secondSid).digest("hex").slice(0, 16);
  const second = `#sessions tr[data-id="${handle}"]`;
  await page.waitForSelector(second);
  const rows = await page.$$eval("#sessions tbody tr", (trs) => trs.map((r) => ({
    current: r.classList.contains("current"), user: r.querySelector(".user").textContent, id: r.dataset.id,
  })));
  const current = rows.filter((r) => r.current);
  check(current.length === 1 && current[0].user === `${admin} (this session)` && current[0].id !== handle,
        `the caller's session is not marked alone: ${JSON.stringify(rows)}`);
  check(!rows.some((r) => r.id === secondSid), "a session id is shown");

  // Their own session: the page asks, and a "no" keeps it.
  const dialogs = [];
  let yes = false;
  page.on("dialog", (d) => {
    dialogs.push(d.message());
    return yes ? d.accept() : d.dismiss();
  });
  await page.click("#sessions tr.current button.revoke");
  check(dialogs.length === 1 && /own session/.test(dialogs[0]), `revoking the own session asked ${JSON.stringify(dialogs)}`);
  check(await page.isVisible("#sessions tr.current"), "the own session went after a 'no'");

  // The second one goes without a question, on the page and on the server.
  check(await whoamiCode(secondSid) === 0, "the second session does not work before it is revoked");
  await page.click(`${second} button.revoke`);
  await page.waitForSelector(second, { state: "detached" });
  check(dialogs.length === 1, "revoking another session asked");
  // A removed session is refused like any unknown id.
  const code = await whoamiCode(secondSid);
  check(code === 105, `whoami with the revoked session: ${code}`);
  check(/revoked/.test(await page.textContent("#sessions .status")), "no word that the session is revoked");

  // A "yes" for their own: signed out, back on the sign-in page.
  yes = true;
  await page.click("#sessions tr.current button.revoke");
  await page.waitForURL(/\/login\.html\?next=admin\.html$/);
  check(dialogs.length === 2, `${dialogs.length} questions, expected 2`);
  const own = await page.evaluate(async () => {
    const r = await fetch("/webapi/entry.cgi?api=VELA.Sample&version=1&method=whoami");
    return (await r.json()).success;
  });
  check(own === false, "the page's own session still works after it was revoked");
}

async function checkBlocked(page) {
  await page.waitForSelector("#blocked-addresses li");
  const addresses = await page.$$eval("#blocked-addresses .who", (s) => s.map((n) => n.textContent));
  check(addresses.includes(blocked), `blocked addresses: ${JSON.stringify(addresses)}`);
  const apis = await page.$$eval("#apis li .api", (s) => s.map((n) => n.textContent));
  check(apis.includes("VELA.Admin v1") && apis.includes("VELA.Sample v1"), `callable APIs: ${JSON.stringify(apis)}`);
}

main("admin", async (browser) => {
  const errors = [];
  const page = await newPage(browser, errors);
  await signInThroughPage(page, admin, adminPass);
  const adminSees = await settled(page);
  if (adminSees !== "panels") {
    check(false, `the administrator's page shows ${adminSees}`);
    return;
  }
  check(await page.isHidden("#adminonly"), "an administrator is told the page is for administrators only");
  await checkUsage(page);
  await checkTask(page);
  await checkBlocked(page);
  // Nothing the server named became markup (run.sh failed a sign-in with
  // an account name that is an <img> tag, should a list name it).
  check(await page.$$eval("main img", (n) => n.length) === 0 && (await page.title()) !== "1",
        "text from the server became markup");

  // Usage collection off: said in words, no chart.
  fs.writeFileSync(infoFile, 'enable_data_collect="no"\n');
  await page.reload();
  await page.waitForFunction(() => /collection is off/.test(document.querySelector("#usage .status").textContent));
  check(await page.isHidden("#usage-box"), "a chart while usage collection is off");
  await checkSessions(page);
  check(errors.length === 0, `script errors: ${errors.join("; ")}`);

  const userErrors = [];
  const userPage = await newPage(browser, userErrors);
  await signInThroughPage(userPage, user, userPass);
  const userSees = await settled(userPage);
  check(userSees === "adminonly" && /administrators only/i.test(await userPage.textContent("#adminonly")),
        `the user's page shows ${userSees}`);
  check(await userPage.isHidden("#panels") && await userPage.isHidden("#error"),
        "the user's page shows the panels or an error");
  check(userErrors.length === 0, `the user's page had script errors: ${userErrors.join("; ")}`);
});
