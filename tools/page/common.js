"use strict";
// Shared by the pages. Each page contains the document that it shows.

const shown = JSON.parse(document.getElementById("document").textContent);

// ---- words ------------------------------------------------------------------------------------------------------------

function formatSize(bytes) {
  if (bytes === null) return "–";
  if (bytes < 1024) return bytes + " B";
  let value = bytes;
  let unit = "B";
  for (const next of ["KB", "MB", "GB"]) {
    if (value < 1024) break;
    value /= 1024;
    unit = next;
  }
  return value.toFixed(1) + " " + unit;
}

const formatWholeSize = (bytes) => formatSize(bytes).replace(".0 ", " ");
const formatCount = (count) => (count === null ? "–" : String(count).replace(/\B(?=(\d{3})+$)/g, ","));
const counted = (count, singular, plural) => formatCount(count) + " " + (count === 1 ? singular : plural);

// ---- pieces -----------------------------------------------------------------------------------------------------------

// Characters that would change the order of the text around them, or cannot be seen, are shown by their numbers.
const hidden = /[\u0000-\u001f\u007f-\u009f\u00ad\u061c\u180e\u200b\u200e\u200f\u2028-\u202e\u2060-\u206f\ufeff\ufff9-\ufffb]|[\udb40-\udb43][\udc00-\udfff]/g;
const hexadecimal = (character) => "\\u" + character.codePointAt(0).toString(16).padStart(4, "0");
const printable = (text) => String(text).replace(hidden, hexadecimal);

function make(name, properties = {}, ...children) {
  const element = document.createElement(name);
  for (const [key, value] of Object.entries(properties)) {
    key === "figure" ? (element.dataset.figure = value) : (element[key] = key === "textContent" ? printable(value) : value);
  }
  element.append(...children);
  return element;
}

// ---- charts -----------------------------------------------------------------------------------------------------------

const colour = (name) => getComputedStyle(document.documentElement).getPropertyValue("--" + name).trim();

Chart.defaults.animation = false;
Chart.defaults.maintainAspectRatio = false;
Chart.defaults.font.family = "system-ui, sans-serif";

// Draws now, and again whenever the colours change: keepDrawn(() => [chart, ...])
function keepDrawn(draw) {
  let charts = draw();
  matchMedia("(prefers-color-scheme: dark)").addEventListener("change", () => {
    for (const chart of charts) chart.destroy();
    charts = draw();
  });
}
