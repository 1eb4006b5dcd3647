// The store's check and repair: one table of findings, or JSON for scripts.
#include <iostream>

#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

std::string textAt(const plist::Dictionary& finding, const char* key) {
  const plist::Value* value = plist::find(finding, key);
  const std::string* text = value ? value->stringIf() : nullptr;
  return text ? *text : "";
}

bool repairedAt(const plist::Dictionary& finding) {
  const plist::Value* value = plist::find(finding, QRTFindingKeyRepaired);
  const bool* repaired = value ? value->booleanIf() : nullptr;
  return repaired && *repaired;
}

std::vector<const plist::Dictionary*> findings(const qk::Reply& reply) {
  std::vector<const plist::Dictionary*> out;
  if (const plist::Array* list = reply.array(QRTReplyKeyFindings))
    for (const plist::Value& item : *list)
      if (const plist::Dictionary* finding = item.dictionaryIf()) out.push_back(finding);
  return out;
}

int verify(G g, A a) {
  const bool repair = a.has("--repair");
  Show show{[repair](const qk::Reply& reply) {
              const auto all = findings(reply);
              size_t repaired = 0;
              if (!all.empty()) {
                std::vector<std::string> headers{"SEVERITY", "FINDING", "SUBJECT", "DETAIL", "ACTION"};
                if (repair) headers.push_back("REPAIRED");
                Table table(std::move(headers));
                for (const plist::Dictionary* finding : all) {
                  std::vector<std::string> row;
                  for (const char* key : {QRTFindingKeySeverity, QRTFindingKeyKind, QRTFindingKeySubject,
                                          QRTFindingKeyDetail, QRTFindingKeyAction})
                    row.push_back(textAt(*finding, key));
                  repaired += repairedAt(*finding) ? 1 : 0;
                  if (repair) row.push_back(repairedAt(*finding) ? "yes" : "no");
                  table.add(std::move(row));
                }
                table.print();
              }
              const uint64_t checked = reply.u64(QRTReplyKeyVerifiedContainers);
              std::cout << checked << (checked == 1 ? " container" : " containers") << " checked, ";
              if (all.empty())
                std::cout << "nothing found\n";
              else
                std::cout << all.size() << (all.size() == 1 ? " finding" : " findings")
                          << (repair ? ", " + std::to_string(repaired) + " repaired" : "") << '\n';
            },
            [](const qk::Reply& reply) -> nlohmann::json {
              nlohmann::json list = nlohmann::json::array();
              for (const plist::Dictionary* finding : findings(reply))
                list.push_back({{"kind", textAt(*finding, QRTFindingKeyKind)},
                                {"severity", textAt(*finding, QRTFindingKeySeverity)},
                                {"subject", textAt(*finding, QRTFindingKeySubject)},
                                {"detail", textAt(*finding, QRTFindingKeyDetail)},
                                {"action", textAt(*finding, QRTFindingKeyAction)},
                                {"repaired", repairedAt(*finding)}});
              return {{"containers", reply.u64(QRTReplyKeyVerifiedContainers)}, {"findings", std::move(list)}};
            }};
  return deliver(
      g, [&](qk::Connection& c) { return qk::verify(c, repair); }, show);
}

const Group kVerify{40,
                    {
                        {"verify",
                         "100",
                         {{"--repair", nullptr, "also fix what is safe to fix"}},
                         {},
                         "Checks that the store, the cache, the sandbox and the code-signing database agree.\n"
                         "Prints one line per finding with its severity and the suggested action. --repair\n"
                         "only forgets, adds again, moves to death row, empties death row and stamps owners\n"
                         "and ACLs anew; it never removes anything outside death row.",
                         verify},
                    }};

const Registration kRegistration(kVerify);

}  // namespace

}  // namespace ctl
