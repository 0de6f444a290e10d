// Uses the page in headless Chromium, before the small system of demo/site.
//
//   node page_test.js BUILD
//
// BUILD is the folder with the executables. Ends with 77 where the machine has no browser or gives
// no namespaces.
"use strict";
const assert = require("node:assert");
const {spawn} = require("node:child_process");
const fs = require("node:fs");
const os = require("node:os");
const path = require("node:path");
const readline = require("node:readline");
const {chromium} = require("playwright-core");

const CHROMIUM = "/usr/bin/chromium";
const SKIPPED = 77;
const TIME_LIMIT_MS = 60000;  // for each step

function startSite(build) {
  const site = spawn(path.join(__dirname, "../../demo/site"), [build], {stdio: "pipe"});
  let errors = "";
  site.stderr.on("data", (text) => errors += text);
  const address = new Promise((resolve, reject) => {
    readline.createInterface({input: site.stdout}).once("line", resolve);
    site.once("close", () => reject(new Error(errors)));
  });
  const stop = () => new Promise((resolve) => {
    site.once("close", resolve);
    site.stdin.end();
  });
  return {address, stop, crash: () => site.stdin.write("\n")};
}

// Does `action` and returns the download that comes of it.
async function downloadOf(page, action) {
  const [download] = await Promise.all([page.waitForEvent("download"), action()]);
  return download;
}

async function expectDownload(download, name, start, offset = 0) {
  assert.strictEqual(download.suggestedFilename(), name);
  const file = fs.readFileSync(await download.path());
  assert.strictEqual(file.subarray(offset, offset + start.length).toString("latin1"), start, name);
  return file;
}

const button = (page, form, name) => page.locator(form).getByRole("button", {name});

// Starts what the form asks for, stops it when a thousand bytes have come, and returns what was
// saved.
async function startAndStop(page, form, name) {
  await button(page, form, name).click();
  await page.locator(form + " output").filter({hasText: /^[1-9].*,... bytes so far$/}).waitFor();
  const download =
      await downloadOf(page, () => button(page, form, "Stop and save").click());
  await page.locator(form + " output").filter({hasText: /^[1-9].*,... bytes saved as /}).waitFor();
  return download;
}

const tests = {
  async "names what it offers, and needs nothing from elsewhere"(page, site, requests) {
    assert.strictEqual(await page.title(), "Debug service");
    const headings = await page.locator("h2").allTextContents();
    assert.deepStrictEqual(
        headings,
        ["Debug archive", "Cores", "Packets", "Processes", "System calls", "Resources"]);
    // Each field has a name that a screen reader can say.
    for (const field of await page.locator("input:not([type=hidden])").all())
      assert.notStrictEqual(await field.evaluate((input) => input.labels[0].textContent), "");
    assert.deepStrictEqual([...new Set(requests.map((url) => new URL(url).origin))],
                           [new URL(site.url).origin]);
  },

  async "downloads the process list"(page) {
    const download = await downloadOf(page, () => page.locator("#get-ps").click());
    await expectDownload(download, "psdump.txt", "    PID TTY");
  },

  async "downloads the core of a process"(page) {
    await page.locator("#core-pid").fill("log-writer");
    const download =
        await downloadOf(page, () => button(page, "#core", "Core of this process").click());
    await expectDownload(download, "core", "\x7fELF");
  },

  async "shows that there is no such process"(page) {
    await page.locator("#core-pid").fill("nobody-has-this-name");
    await button(page, "#core", "Core of this process").click();
    await page.getByText("The request has bad syntax").waitFor();
    await page.goBack();
    await page.locator("#trace-pid").fill("nobody-has-this-name");
    await button(page, "#trace", "Trace these").click();
    await page.locator("#trace output.bad")
        .filter({hasText: /^400 Bad Request: The request has bad syntax/}).waitFor();
  },

  async "waits for a crash"(page, site) {
    const arrived = page.waitForEvent("download");
    await button(page, "#crash", "Wait for the next crash").click();
    // A core that comes before the request is dropped, so there is another until one has arrived.
    const more = setInterval(site.crash, 3000);
    site.crash();
    try {
      await expectDownload(await arrived, "core", "\x7fELF");
    } finally {
      clearInterval(more);
    }
  },

  async "stops waiting for a crash"(page) {
    const asked = page.waitForRequest(/cmd=coredump/);
    await button(page, "#crash", "Wait for the next crash").click();
    await asked;
    await button(page, "#crash", "Stop and save").click();
    await page.getByText("Stopped before an answer came").waitFor();
  },

  async "downloads a capture that ends by itself"(page) {
    await page.locator("#duration").fill("1");
    const download =
        await downloadOf(page, () => button(page, "#capture", "Capture on eth0").click());
    await expectDownload(download, "pcapdump.cap", "\xd4\xc3\xb2\xa1\x02\x00\x04\x00");
  },

  async "keeps what a capture has when it is stopped"(page) {
    await page.locator("#duration").fill("0");
    await page.locator("#totalsize").fill("0");
    const download = await startAndStop(page, "#capture", "Capture on eth0");
    await expectDownload(download, "pcapdump.cap", "\xd4\xc3\xb2\xa1\x02\x00\x04\x00");
  },

  async "keeps what a trace has when it is stopped"(page) {
    await page.locator("#trace-pid").fill("log-writer, tcp-client");
    const trace = await expectDownload(
        await startAndStop(page, "#trace", "Trace these"), "stracedump.txt", "");
    assert.match(trace.toString(), /write\(/);
    const all = await expectDownload(
        await startAndStop(page, "#trace-all", "Trace all processes"), "stracedump.txt", "");
    assert.match(all.toString(), /pipe-/);
  },

  async "keeps what a resource trace has when it is stopped"(page) {
    await page.locator("#interval").fill("1");
    await page.locator("#items").fill("meminfo,filenr");
    const samples = await expectDownload(
        await startAndStop(page, "#resources-form", "Sample resources"), "rtrace", "");
    assert.match(samples.toString(), /MemTotal/);
  },

  async "downloads one archive at a time, and shows a second one the 503 text"(page) {
    const archive = await downloadOf(page, () => page.locator("#get-tgz").click());
    await page.locator("#get-tar").click();
    await page.getByText("Another Crash Report generation is in progress. Please try again later")
        .waitFor();
    await page.goBack();
    await expectDownload(archive, "debug.tgz", "\x1f\x8b");
    const plain = await downloadOf(page, () => page.locator("#get-tar").click());
    await expectDownload(plain, "debug.tar", "ustar", 257);
  },
};

async function runTests(browser, site) {
  let failures = 0;
  for (const [name, test] of Object.entries(tests)) {
    const context = await browser.newContext();
    context.setDefaultTimeout(TIME_LIMIT_MS);
    const page = await context.newPage();
    const requests = [];
    const errors = [];
    page.on("request", (request) => requests.push(request.url()));
    page.on("pageerror", (error) => errors.push(error));
    try {
      await page.goto(site.url);
      await test(page, site, requests.filter((url) => !url.startsWith("data:")
        && !url.startsWith("blob:")));
      assert.deepStrictEqual(errors, []);
      console.log("ok      " + name);
    } catch (error) {
      ++failures;
      console.log("FAILED  " + name + "\n" + error.stack);
    }
    await context.close();
  }
  return failures;
}

async function main() {
  if (!fs.existsSync(CHROMIUM)) {
    console.log("skipped: there is no " + CHROMIUM);
    return SKIPPED;
  }
  const site = startSite(process.argv[2]);
  try {
    site.url = await site.address;
  } catch (error) {
    console.log(error.message);
    return /gives no namespaces/.test(error.message) ? SKIPPED : 1;
  }
  const profile = fs.mkdtempSync(path.join(os.tmpdir(), "fieldkit-browser."));
  let failures = 1;
  try {
    const browser = await chromium.launch({
      executablePath: CHROMIUM,
      downloadsPath: profile,
      // It runs as whoever runs the tests, root perhaps, and talks to nobody but the page.
      args: ["--no-sandbox", "--disable-gpu", "--disable-quic", "--no-first-run",
             "--disable-background-networking", "--disable-component-update", "--disable-sync"],
    });
    failures = await runTests(browser, site);
    await browser.close();
  } finally {
    fs.rmSync(profile, {recursive: true, force: true});
    await site.stop();
  }
  return failures === 0 ? 0 : 1;
}

main().then((status) => process.exitCode = status, (error) => {
  console.log(error.stack);
  process.exitCode = 1;
});
