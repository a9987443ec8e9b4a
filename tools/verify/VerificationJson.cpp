#include "verify/VerificationJson.h"

#include "storage/Layout.h"

namespace velmora::mobile::xplat::cellar::tools {

nlohmann::ordered_json verificationAsJson(const Layout& layout, const VerificationResult& result) {
  auto findings = nlohmann::ordered_json::array();
  for (const SettledFinding& settled : result.all) {
    findings.push_back({{"kind", textOf(settled.finding.kind)},
                        {"path", settled.path},
                        {"name", settled.finding.name},
                        {"text", describe(settled.finding)},
                        {"recorded_bytes", settled.finding.recorded},
                        {"actual_bytes", settled.finding.actual},
                        {"repaired", settled.isRepaired},
                        {"outcome", settled.outcome}});
  }
  return {{"root", layout.root},       {"empty", layout.kind == Layout::Kind::Empty},
          {"stores", result.stores},   {"repaired", result.repaired},
          {"locked", result.isLocked}, {"findings", std::move(findings)}};
}

}  // namespace velmora::mobile::xplat::cellar::tools
