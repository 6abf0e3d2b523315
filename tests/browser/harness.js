// What the browser tests share: their arguments, bounded waits, the count of
// failed checks, the log of what the pages did, and headless Chromium.
// A test calls main() with its steps; main() prints the log when a check
// failed and exits 0 when every check passed, 1 otherwise.
"use strict";

const path = require("path");
const { chromium } = require("playwright-core");

// Bounded waits: a slow machine gets time, a broken page an answer.
const STEP_MS = 60000;

let failures = 0;
// What the pages loaded and logged, printed when a check failed.
const pageLog = [];

function check(ok, message) {
  if (!ok) {
    console.log(`FAIL: ${message}`);
    failures++;
  }
}

// The command line's arguments, one for each of `names`; the usage and exit
// 2 when one is missing or empty.
function args(...names) {
  const given = process.argv.slice(2, 2 + names.length);
  if (given.length < names.length || given.some((a) => !a)) {
    console.error(`usage: node ${path.basename(process.argv[1])} ${names.join(" ")}`);
    process.exit(2);
  }
  return given;
}

// Gives `page` the bounded wait and logs its console lines, script errors
// (also pushed to `errors` when given) and responses.
function watch(page, errors) {
  page.setDefaultTimeout(STEP_MS);
  page.on("console", (m) => pageLog.push(`console.${m.type()}: ${m.text()}`));
  page.on("pageerror", (e) => {
    pageLog.push(`page error: ${e.message}`);
    if (errors) {
      errors.push(e.message);
    }
  });
  page.on("response", (r) => pageLog.push(`${r.status()} ${r.request().method()} ${r.url()}`));
  return page;
}

// Runs `steps(browser)` with Chromium (CHROMIUM, default /usr/bin/chromium),
// closes it, and exits; a step that throws is a failed check. `name` goes
// into the line that says all passed.
function main(name, steps) {
  const run = async () => {
    const browser = await chromium.launch({
      executablePath: process.env.CHROMIUM || "/usr/bin/chromium",
      args: ["--no-sandbox"],
      timeout: STEP_MS,
    });
    try {
      await steps(browser);
    } finally {
      await browser.close();
    }
  };
  run().catch((e) => check(false, e.stack || e)).then(() => {
    if (failures !== 0) {
      console.log(`---- what the pages did\n${pageLog.join("\n")}\n${failures} check(s) failed`);
    } else {
      console.log(`browser ${name} checks passed`);
    }
    process.exit(failures === 0 ? 0 : 1);
  });
}

module.exports = { STEP_MS, pageLog, check, args, watch, main };
