// Opens a page of `cellar inspect --html` as a phone and a desk do, in light and in dark, and holds it against the document
// of `--json`: look.mjs PAGE JSON SCREENSHOTS
import assert from "node:assert/strict";
import { readFileSync } from "node:fs";
import { join, resolve } from "node:path";
import { pathToFileURL } from "node:url";
import { createRequire } from "node:module";

const [page, json, screenshots] = process.argv.slice(2);
const modules = process.env.CELLAR_PAGE_MODULES;
const { chromium } = createRequire(join(resolve(modules), "x.js"))("playwright-core");
const survey = JSON.parse(readFileSync(json, "utf8"));

const views = [
  { name: "light", width: 1280, height: 900, colorScheme: "light" },
  { name: "dark", width: 1280, height: 900, colorScheme: "dark" },
  { name: "phone", width: 390, height: 844, colorScheme: "light" },
  { name: "phone-dark", width: 390, height: 844, colorScheme: "dark" },
];

// ---- what the page should say, worked out apart from it -----------------------------------------------------------------

function size(bytes) {
  for (const [unit, shift] of [["GB", 30], ["MB", 20], ["KB", 10]]) {
    if (bytes >= 2 ** shift) return (bytes / 2 ** shift).toFixed(1) + " " + unit;
  }
  return bytes + " B";
}

function age(date) {
  const passed = survey.inspected_at - date;
  if (passed < 0) return "in the future";
  const units = { year: 365 * 24 * 3600, day: 24 * 3600, hour: 3600, minute: 60 };
  const unit = Object.keys(units).find((name) => passed >= units[name]);
  if (unit === undefined) return "now";
  const number = Math.trunc(passed / units[unit]);
  return number.toLocaleString("en-US") + " " + unit + (number === 1 ? "" : "s") + " ago";
}

function expected(path) {
  const value = path.split(".").reduce((object, key) => object[key], survey);
  assert.notEqual(value, undefined, path);
  const key = path.split(".").pop();
  if (key.endsWith("bytes")) return size(value);
  if (key.endsWith("access")) return age(value);
  if (key === "fill") return Math.round(value * 100) + " %";
  return value.toLocaleString("en-US");
}

const sum = (numbers) => numbers.reduce((total, number) => total + number, 0);

// ---- looking ------------------------------------------------------------------------------------------------------------

async function checkFigures(tab) {
  const figures = await tab.$$eval("[data-figure]", (all) => all.map((one) => [one.dataset.figure, one.textContent]));
  for (const [path, text] of figures) assert.equal(text, expected(path), path);
  const named = new Set(figures.map(([path]) => path));
  for (const key of Object.keys(survey.totals)) {
    if (key !== "leftover_bytes") assert.ok(named.has("totals." + key), "no figure for " + key);
  }
  survey.managers.forEach((manager, m) => manager.stores.forEach((store, s) => {
    for (const key of ["items", "held_bytes", "allocated_bytes"]) assert.ok(named.has(`managers.${m}.stores.${s}.${key}`), store.path);
  }));
  return figures.length;
}

async function checkCharts(tab) {
  const drawn = await tab.evaluate(() => Object.fromEntries(["stores", "ages", "sizes"].map((id) => {
    const { labels, datasets } = Chart.getChart(id).data;
    return [id, { labels, values: datasets[0].data.map((value) => value ?? 0) }];
  })));
  const all = survey.managers.flatMap((manager) => manager.stores);
  assert.equal(sum(drawn.stores.values), sum(all.map((store) => store.allocated_bytes)));
  assert.equal(sum(drawn.stores.values), survey.totals.allocated_bytes);
  assert.deepEqual(drawn.ages, { labels: survey.ages.map((one) => one.label), values: survey.ages.map((one) => one.bytes) });
  assert.deepEqual(drawn.sizes, { labels: survey.sizes.map((one) => one.label), values: survey.sizes.map((one) => one.items) });
  const undrawn = await tab.evaluate(() => ["stores", "ages", "sizes"].filter((id) => {
    const { canvas, data: { datasets: [bars] } } = Chart.getChart(id);
    const place = bars.data.findIndex((value) => value > 0);
    if (place < 0) return false;
    const colour = Array.isArray(bars.backgroundColor) ? bars.backgroundColor[place] : bars.backgroundColor;
    const wanted = [1, 3, 5].map((at) => parseInt(colour.slice(at, at + 2), 16));
    const { data } = canvas.getContext("2d").getImageData(0, 0, canvas.width, canvas.height);
    for (let at = 0; at < data.length; at += 4) {
      if (data[at + 3] === 255 && wanted.every((value, channel) => data[at + channel] === value)) return false;
    }
    return true;
  }));
  assert.deepEqual(undrawn, [], "charts without a bar");
}

async function look(browser, view) {
  const context = await browser.newContext({
    viewport: { width: view.width, height: view.height }, deviceScaleFactor: 2, colorScheme: view.colorScheme, offline: true,
  });
  const tab = await context.newPage();
  const complaints = [];
  tab.on("console", (message) => { if (["error", "warning"].includes(message.type())) complaints.push(message.text()); });
  tab.on("pageerror", (error) => complaints.push(String(error)));
  tab.on("request", (request) => { if (!/^(file|data):/.test(request.url())) complaints.push("asks for " + request.url()); });
  await tab.goto(pathToFileURL(resolve(page)).href);
  const figures = await checkFigures(tab);
  await checkCharts(tab);
  const tooWide = await tab.evaluate(() => document.documentElement.scrollWidth - document.documentElement.clientWidth);
  assert.equal(tooWide, 0, "the page is wider than the screen");
  const [ground, ink] = await tab.evaluate(() => [getComputedStyle(document.body).backgroundColor, getComputedStyle(document.body).color]);
  const brightness = (colour) => sum(colour.match(/\d+/g).slice(0, 3).map(Number));
  assert.equal(brightness(ground) < brightness(ink), view.colorScheme === "dark", "colours of " + view.name);
  await tab.screenshot({ path: join(screenshots, view.name + ".png"), fullPage: true });
  assert.deepEqual(complaints, []);
  await context.close();
  console.log(`${view.name}: ${figures} figures as in the document, 3 charts, no complaint`);
}

// Its profile is a new and empty one, and goes with it.
const args = ["--headless", "--no-sandbox", "--disable-gpu", "--disable-quic", "--no-first-run", "--disable-background-networking",
  "--disable-component-update", "--disable-sync"];
const browser = await chromium.launch({ executablePath: "/usr/bin/chromium", args });
try {
  for (const view of views) await look(browser, view);
} finally {
  await browser.close();
}
