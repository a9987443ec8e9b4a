// Fills the page from the survey in it. The attribute `data-figure` of each figure is its path in the document.

const survey = shown;

// ---- words ------------------------------------------------------------------------------------------------------------

const kinds = { unmanaged: "unmanaged", keyed: "with keys", pkvs: "key-value", disk_cache: "disk cache" };
const leftoverKinds = {
  other_version: "another version", other_session: "another session", not_configured: "not configured",
  temporary: "temporary files", trash: "trash", quarantine: "quarantine",
};

const formatFill = (fill) => (fill === null ? "–" : Math.round(fill * 100) + " %");

function formatAge(date) {
  if (date === null) return "–";
  const seconds = survey.inspected_at - date;
  for (const [unit, length] of [["year", 31536000], ["day", 86400], ["hour", 3600], ["minute", 60]]) {
    const number = Math.floor(seconds / length);
    if (number >= 1) return counted(number, unit, unit + "s") + " ago";
  }
  return seconds < 0 ? "in the future" : "now";
}

// ---- pieces -----------------------------------------------------------------------------------------------------------

const figure = (name, path, text, properties = {}) => make(name, { ...properties, figure: path, textContent: text });

function meter(fill) {
  const bar = make("i");
  bar.style.width = Math.min(100, fill * 100) + "%";
  return make("div", { className: "meter" + (fill > 1 ? " full" : "") }, bar);
}

function itemList(title, items) {
  const list = make("ol");
  for (const item of items) {
    list.append(make("li", {}, make("span", { textContent: item.key }),
      make("span", { textContent: formatSize(item.bytes) + ", " + formatAge(item.last_access) + (item.reason ? "; " + item.reason : "") })));
  }
  return make("details", {}, make("summary", { textContent: title }), list);
}

function storeLimit(store) {
  if (store.limit_bytes !== null) return formatSize(store.limit_bytes);
  return store.capacity === null ? null : counted(store.capacity, "item", "items");
}

function storeFigures(store, at) {
  const list = make("dl");
  const add = (title, path, text) => list.append(make("dt", { textContent: title }), figure("dd", at + path, text));
  add("Items", "items", formatCount(store.items));
  if (store.recorded_bytes !== null) add("Recorded", "recorded_bytes", formatSize(store.recorded_bytes));
  add("Held", "held_bytes", formatSize(store.held_bytes));
  add("On disk", "allocated_bytes", formatSize(store.allocated_bytes));
  if (store.oldest_access !== null) add("Oldest use", "oldest_access", formatAge(store.oldest_access));
  if (store.newest_access !== null) add("Last use", "newest_access", formatAge(store.newest_access));
  if (store.stale_items !== null) add("Stale", "stale_items", formatCount(store.stale_items));
  if (store.durability !== null) list.append(make("dt", { textContent: "Durability" }), make("dd", { textContent: store.durability }));
  if (store.quarantined_bytes) add("In quarantine", "quarantined_bytes", formatSize(store.quarantined_bytes));
  if (store.items_to_prune) add("A prune would remove", "items_to_prune", formatCount(store.items_to_prune));
  return list;
}

function storeCard(store, at) {
  const card = make("article", { className: "store" });
  const badges = make("span", {}, make("span", { className: "badge", textContent: kinds[store.kind] }));
  if (store.leftover) badges.append(" ", make("span", { className: "badge alarm", textContent: leftoverKinds[store.leftover] }));
  card.append(make("div", { className: "top" }, make("h3", { textContent: store.directory }), badges));
  const limit = storeLimit(store);
  if (store.fill !== null) {
    card.append(meter(store.fill), make("p", { className: "quiet" },
      figure("span", at + "fill", formatFill(store.fill)), " of " + limit));
  }
  card.append(storeFigures(store, at));
  for (const damage of store.damages) card.append(make("p", { className: "damage", textContent: "Damaged manifest: " + damage }));
  if (store.largest.length > 0) card.append(itemList("Largest", store.largest));
  if (store.next_to_go.length > 0) card.append(itemList("Next to be evicted by " + store.eviction_order, store.next_to_go));
  return card;
}

function managerCard(manager, at) {
  const card = make("section", { className: "card manager" });
  const title = manager.name || (manager.path.startsWith(".") ? manager.directory : manager.path);
  const where = [manager.name ? manager.path : "", manager.session === null ? "" : "session " + manager.session_name];
  card.append(make("div", { className: "top" }, make("h2", { textContent: title }),
    make("span", { className: "quiet", textContent: where.filter(Boolean).join(", ") })));
  if (manager.fill !== null) {
    const fill = make("p", { className: "quiet" },
      figure("span", at + "counted_bytes", formatSize(manager.counted_bytes)), " of ",
      figure("span", at + "limit_bytes", formatSize(manager.limit_bytes)));
    if (manager.unmanaged_bytes > 0) {
      fill.append(", of which ", figure("span", at + "unmanaged_bytes", formatSize(manager.unmanaged_bytes)),
        " measured now in unmanaged stores");
    }
    card.append(meter(manager.fill), fill);
  }
  const stores = make("div", { className: "stores" });
  manager.stores.forEach((store, index) => stores.append(storeCard(store, at + "stores." + index + ".")));
  card.append(stores);
  return card;
}

// ---- the page ---------------------------------------------------------------------------------------------------------

function fillHeader() {
  const name = survey.root.split("/").pop() || survey.root;
  document.title = printable("Storage in " + name);
  document.getElementById("title").textContent = printable("Storage in " + name);
  const date = new Date(survey.inspected_at * 1000).toISOString().slice(0, 16).replace("T", " ");
  document.getElementById("subtitle").textContent = printable(survey.root) + " · " + date + " UTC";
}

function fillTiles() {
  const totals = survey.totals;
  const tiles = [
    ["On disk", "allocated_bytes", formatSize(totals.allocated_bytes)], ["Values", "held_bytes", formatSize(totals.held_bytes)],
    ["Manifests", "manifest_bytes", formatSize(totals.manifest_bytes)], ["Items", "items", formatCount(totals.items)],
    ["Stores", "stores", formatCount(totals.stores)],
    ["Left over", "leftover_allocated_bytes", formatSize(totals.leftover_allocated_bytes)],
  ];
  for (const [title, path, text] of tiles) {
    document.getElementById("tiles").append(make("div", { className: "tile" },
      figure("b", "totals." + path, text), make("span", { className: "quiet", textContent: title })));
  }
}

function fillManagers() {
  survey.managers.forEach((manager, index) => {
    document.getElementById("managers").append(managerCard(manager, "managers." + index + "."));
  });
}

function fillUnreadable() {
  if (survey.unreadable.length === 0) return;
  const section = document.getElementById("unreadable");
  section.hidden = false;
  for (const part of survey.unreadable) {
    section.querySelector("tbody").append(make("tr", {}, make("td", { textContent: part.path }), make("td", { textContent: part.reason })));
  }
}

function fillLeftovers() {
  if (survey.leftovers.length === 0) return;
  const section = document.getElementById("leftovers");
  section.hidden = false;
  survey.leftovers.forEach((leftover, index) => {
    const at = "leftovers." + index + ".";
    section.querySelector("tbody").append(make("tr", {}, make("td", { textContent: leftover.path }),
      make("td", { textContent: leftoverKinds[leftover.kind] }),
      figure("td", at + "files", formatCount(leftover.files), { className: "number" }),
      figure("td", at + "bytes", formatSize(leftover.bytes), { className: "number" }),
      figure("td", at + "allocated_bytes", formatSize(leftover.allocated_bytes), { className: "number" })));
  });
}

// ---- charts -----------------------------------------------------------------------------------------------------------

const shownStores = 14;

// The largest stores, and the rest as one.
function bytesByStore() {
  const stores = survey.managers.flatMap((manager) => manager.stores.map((store) => (
    { label: printable(store.directory), bytes: store.allocated_bytes, leftover: store.leftover !== null })));
  stores.sort((a, b) => b.bytes - a.bytes);
  const rest = stores.slice(shownStores);
  const shown = stores.slice(0, shownStores);
  if (rest.length > 0) {
    shown.push({ label: rest.length + " more", bytes: rest.reduce((sum, store) => sum + store.bytes, 0), leftover: false });
  }
  return shown;
}

// Sizes have units of powers of two, and so have the marks of their axis.
function sizeStep(values) {
  const fifth = Math.max(1, ...values) / 5;
  return 2 ** Math.ceil(Math.log2(fifth));
}

// "< 30 days" in two lines, because bars are narrow.
function inTwoLines(value) {
  const words = this.getLabelForValue(value).split(" ");
  return words.length < 2 ? words : [words.slice(0, -1).join(" "), words.at(-1)];
}

function chart(id, horizontal, labels, values, colours, format, tooltip) {
  const measured = { beginAtZero: true, grid: { color: colour("line"), drawBorder: false },
    ticks: { color: colour("quiet"), maxTicksLimit: 8, maxRotation: 0, callback: format, ...(format === sizeTick ? { stepSize: sizeStep(values) } : { precision: 0 }) } };
  const named = { grid: { display: false, borderColor: colour("line") },
    ticks: { color: colour("quiet"), autoSkip: false, maxRotation: 0, ...(horizontal ? {} : { callback: inTwoLines }) } };
  return new Chart(document.getElementById(id), {
    type: "bar",
    data: { labels, datasets: [{ data: values.map((value) => value || null), backgroundColor: colours, borderRadius: 5, maxBarThickness: 34, minBarLength: 2 }] },
    options: {
      indexAxis: horizontal ? "y" : "x",
      plugins: { legend: { display: false }, tooltip: { displayColors: false, callbacks: { label: (context) => tooltip(context.dataIndex) } } },
      scales: horizontal ? { x: measured, y: named } : { x: named, y: measured },
    },
  });
}

function sizeTick(value) { return value % 1 === 0 ? formatWholeSize(value) : ""; }
function countTick(value) { return value % 1 === 0 ? formatCount(value) : ""; }

function drawCharts() {
  const stores = bytesByStore();
  document.getElementById("stores-frame").style.height = Math.max(8, 3.5 + stores.length * 2.25) + "rem";
  const detail = (bucket) => counted(bucket.items, "item", "items") + ", " + formatSize(bucket.bytes);
  return [
    chart("stores", true, stores.map((store) => store.label), stores.map((store) => store.bytes),
      stores.map((store) => colour(store.leftover ? "alarm" : "accent")), sizeTick, (index) => formatSize(stores[index].bytes)),
    chart("ages", false, survey.ages.map((bucket) => bucket.label), survey.ages.map((bucket) => bucket.bytes), colour("third"),
      sizeTick, (index) => detail(survey.ages[index])),
    chart("sizes", false, survey.sizes.map((bucket) => bucket.label), survey.sizes.map((bucket) => bucket.items), colour("second"),
      countTick, (index) => detail(survey.sizes[index])),
  ];
}

fillHeader();
fillTiles();
fillManagers();
fillUnreadable();
fillLeftovers();
keepDrawn(drawCharts);
