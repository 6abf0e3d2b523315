// Drives deploy/www/share.html in headless Chromium as a visitor of a
// sharing link with a password: an unknown link and a wrong password show
// their errors; the right password lists the shared folder (names shown as
// text), a sub-folder is entered, and a file downloaded whole through its
// plain link and in part with a byte range equals the file on disk.
//
// usage: node share.test.js BASE_URL LINK_ID PASSWORD FILE
// FILE is sub/<name> of the shared folder. Exit 0 when every check passed, 1
// otherwise. CHROMIUM names the browser (default /usr/bin/chromium).
"use strict";

const fs = require("fs");
const path = require("path");
const { STEP_MS, check, args, watch, main } = require("./harness");

const [base, link, password, file] = args("BASE_URL", "LINK_ID", "PASSWORD", "FILE");
const MARKUP_NAME = "<img src=x onerror=alert(1)>.txt";

// Waits until the page shows an error, or `until`: "asked" the password
// form, else a listing holding that name; what it shows.
async function shown(page, until) {
  const handle = await page.waitForFunction((wanted) => {
    const visible = (id) => !document.getElementById(id).closest("[hidden]");
    const error = visible("error") ? document.getElementById("error").textContent.trim() : "";
    const names = visible("browser") ? [...document.querySelectorAll("#files li > :first-child")].map((e) => e.textContent) : [];
    const asked = visible("unlock");
    return error !== "" || (asked && wanted === "asked") || names.includes(wanted) ? { error, names, asked } : null;
  }, until, { timeout: STEP_MS });
  return handle.jsonValue();
}

async function newPage(context, where) {
  const page = watch(await context.newPage());
  page.on("dialog", (d) => { check(false, `the page opened a dialog: ${d.message()}`); d.dismiss(); });
  const reply = await page.goto(`${base}/share.html${where}`);
  check(reply && reply.status() === 200, `share.html: HTTP ${reply && reply.status()}`);
  return page;
}

main("share", async (browser) => {
  const context = await browser.newContext({ acceptDownloads: true });

  // A well-formed id no link has (the link in the query), and junk.
  const unknown = await shown(await newPage(context, `?link=${"A".repeat(22)}`), "error");
  check(/no such link/i.test(unknown.error) && !unknown.asked, `unknown link shows ${JSON.stringify(unknown)}`);
  const junk = await shown(await newPage(context, "#%E0%A4%A"), "error");
  check(/does not name a sharing link/i.test(junk.error), `a malformed id shows ${JSON.stringify(junk)}`);

  // The link asks for its password; a wrong one is refused, no folder shown.
  const page = await newPage(context, `#${link}`);
  const asked = await shown(page, "asked");
  check(asked.asked && asked.error === "", `the link first shows ${JSON.stringify(asked)}`);
  await page.fill("#password", `x${password}`);
  await page.click("#open");
  const wrong = await shown(page, "error");
  check(/wrong password/i.test(wrong.error) && wrong.names.length === 0, `wrong password shows ${JSON.stringify(wrong)}`);

  // The right one lists the folder; a name that looks like markup stays text.
  await page.fill("#password", password);
  await page.click("#open");
  const top = await shown(page, "sub/");
  check(top.error === "" && !top.asked, `after the password the page shows ${JSON.stringify(top)}`);
  check(top.names.includes(MARKUP_NAME), `the listing lacks the name ${MARKUP_NAME}: ${JSON.stringify(top.names)}`);
  check(await page.locator("#files img").count() === 0, "a file name became an element");
  if (!top.names.includes("sub/")) {
    return;  // nothing listed: the rest cannot be checked
  }

  // Into the sub-folder; the file through its plain link, whole and a range.
  const name = path.basename(file);
  await page.click("#files button");
  const sub = await shown(page, name);
  check(sub.error === "", `the sub-folder shows ${JSON.stringify(sub)}`);
  const want = fs.readFileSync(file);
  const anchor = page.locator("#files a", { hasText: name });
  const [download] = await Promise.all([page.waitForEvent("download"), anchor.click()]);
  const got = fs.readFileSync(await download.path());
  check(download.suggestedFilename() === name, `downloaded as ${download.suggestedFilename()}`);
  check(got.equals(want), `downloaded ${got.length} bytes that differ from the file's ${want.length}`);
  const part = await page.evaluate(async (href) => {
    const r = await fetch(href, { headers: { Range: "bytes=1000-1999" } });
    return { status: r.status, bytes: [...new Uint8Array(await r.arrayBuffer())] };
  }, await anchor.getAttribute("href"));
  check(part.status === 206 && Buffer.from(part.bytes).equals(want.subarray(1000, 2000)),
        `a range of the plain link: HTTP ${part.status}, ${part.bytes.length} bytes`);

  await page.click("#up");
  const back = await shown(page, "sub/");
  check(back.error === "", `up shows ${JSON.stringify(back)}`);
});
