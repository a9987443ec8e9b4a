#include "tune/TunePage.h"

#include <nlohmann/json.hpp>

#include "Printable.h"
#include "page/Page.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Json = nlohmann::ordered_json;

Json asJson(const TuneTexts& texts) {
  Json columns = Json::array();
  for (const Table::Column& column : texts.columns) columns.push_back(column.title);
  return {{"title", texts.title}, {"notes", texts.notes},   {"columns", std::move(columns)},
          {"rows", texts.rows},   {"advice", texts.advice}, {"cost", texts.cost}};
}

Json curveOf(const Tuning& tuning) {
  Json curve = Json::array();
  for (const HitCurve::Point& point : tuning.curve) {
    curve.push_back({{"limit", point.limit},
                     {"hit_rate", share(point.hits, tuning.requests)},
                     {"byte_hit_rate", share(point.hitBytes, tuning.requestedBytes)}});
  }
  return curve;
}

}  // namespace

std::string tuningAsPage(const TuneReport& report) {
  Json document = tuningAsJson(report);
  document["texts"] = asJson(textsOf(report));
  document["curve"] = curveOf(report.tuning);
  return pageOf(kTunePage, printable(document, -1));
}

}  // namespace velmora::mobile::xplat::cellar::tools
