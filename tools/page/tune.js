// Fills the page from the report in it, and draws the hit rate over the limit.

// ---- the page ---------------------------------------------------------------------------------------------------------

const fill = (id, text) => (document.getElementById(id).textContent = printable(text));

function fillTexts() {
  document.title = printable(shown.texts.title);
  for (const id of ["title", "advice", "cost"]) fill(id, shown.texts[id]);
  for (const note of shown.texts.notes) document.getElementById("notes").append(make("p", { className: "quiet", textContent: note }));
}

// All columns but the last, which has remarks, are figures. On a phone there is room for the limit and the hit rates.
function fillTable() {
  const { columns, rows } = shown.texts;
  const kindOf = (column, index) => {
    if (index + 1 === columns.length) return "remark";
    return column === "of bytes" || column.startsWith("misses") ? "number secondary" : "number";
  };
  const kinds = columns.map(kindOf);
  const cells = (name, texts) => texts.map((text, index) => make(name, { className: kinds[index], textContent: text }));
  document.querySelector("#limits tr").append(...cells("th", columns));
  document.querySelector("#limits tbody").append(...rows.map((row) => make("tr", {}, ...cells("td", row))));
}

// ---- the chart --------------------------------------------------------------------------------------------------------

// A limit's place on the axis: each doubling is one step.
const placeOf = (limit) => Math.log2(limit);
const percent = (share) => (share * 100).toFixed(1) + " %";

function curve(label, name, points, dash = []) {
  return { label, data: points, borderColor: colour(name), backgroundColor: colour(name), borderDash: dash, borderWidth: 2, pointRadius: 0,
    pointHitRadius: 8 };
}

// A limit that is advised, or in use: a line through the whole height.
function mark(what, limit) {
  const x = placeOf(limit.limit);
  const label = what + ": " + formatWholeSize(limit.limit) + ", " + percent(limit.hit_rate);
  return { ...curve(label, "quiet", [{ x, y: 0 }, { x, y: 1 }], [4, 4]), isMark: true };
}

// With the present strategy, of which the figures of a limit may not be those in its row itself.
function presentLimit() {
  const { present, strategy } = shown;
  if (present === null || strategy === "lru") return present;
  return { limit: present.limit, hit_rate: present.strategies[strategy].hits / shown.requests };
}

function marks() {
  const { advice } = shown;
  const present = presentLimit();
  const isAdvised = advice !== null && present !== null && advice.limit === present.limit;
  if (isAdvised && advice.strategy === shown.strategy) return [mark("present, and enough", advice)];
  return [["enough", advice], ["present", present]].filter(([, limit]) => limit !== null).map(([what, limit]) => mark(what, limit));
}

function curves() {
  const all = [
    curve("lru", "accent", shown.curve.map((point) => ({ x: placeOf(point.limit), y: point.hit_rate }))),
    curve("lru, bytes", "third", shown.curve.map((point) => ({ x: placeOf(point.limit), y: point.byte_hit_rate })), [6, 4]),
  ];
  const drawn = [["greedy_dual", "greedy_dual", "second"], ["video_download", "video_download", "alarm", [2, 3]],
    ["foresight", "with foresight", "quiet", [1, 3]]];
  for (const [strategy, label, name, dash] of drawn) {
    const simulated = shown.limits.filter((limit) => limit.strategies?.[strategy] !== undefined);
    if (simulated.length === 0) continue;
    all.push(curve(label, name, simulated.map((limit) => (
      { x: placeOf(limit.limit), y: limit.strategies[strategy].hits / shown.requests })), dash));
  }
  return all;
}

function drawCurves() {
  const grid = { color: colour("line"), drawBorder: false };
  const ticks = { color: colour("quiet"), maxRotation: 0 };
  return [new Chart(document.getElementById("curve"), {
    type: "line",
    data: { datasets: [...curves(), ...marks()] },
    options: {
      interaction: { mode: "nearest", axis: "x", intersect: false },
      plugins: {
        legend: { align: "start", labels: { color: colour("ink"), boxWidth: 24, boxHeight: 0 } },
        tooltip: {
          filter: (item) => !item.dataset.isMark,
          callbacks: {
            title: (items) => (items.length > 0 ? formatSize(Math.round(2 ** items[0].parsed.x)) : ""),
            label: (item) => item.dataset.label + ": " + percent(item.parsed.y),
          },
        },
      },
      scales: {
        x: { type: "linear", grid, ticks: { ...ticks, stepSize: 1, callback: (place) => formatWholeSize(2 ** place) } },
        y: { min: 0, max: 1, grid, ticks: { ...ticks, stepSize: 0.2, callback: (share) => Math.round(share * 100) + " %" } },
      },
    },
  })];
}

fillTexts();
fillTable();
keepDrawn(drawCurves);
