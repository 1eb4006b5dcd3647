// Subcommands for group containers and the code-signing information that
// decides who may reach them.
#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

std::optional<plist::Value> codeSigningInfo(A a) {
  std::optional<plist::Value> info;
  for (const auto& [flag, value] : a.given) {
    if (flag == "--entitlements")
      info = plist::Dictionary{{"com.norvane.QuarterKit.Entitlements", readDictionaryFile(value)}};
    else if (flag == "--cs-info")
      info = readDictionaryFile(value);
    else if (flag == "--remove")
      info.reset();
  }
  return info;
}

plist::Dictionary codeSigningOptions(A a) {
  plist::Dictionary options;
  if (auto v = a.value("--data-class"))
    options["com.norvane.QuarterKit.DataContainerClass"] = parseUnsigned(*v, "--data-class");
  if (auto v = a.value("--parent")) options["com.norvane.QuarterKit.ParentBundleID"] = *v;
  if (a.has("--placeholder")) options["com.norvane.QuarterKit.PlaceholderEntitlements"] = true;
  if (a.has("--by-caller")) options["RegByCaller"] = true;
  return options;
}

uint64_t userOr1(A a) { return a.has("--user") ? parseUnsigned(*a.value("--user"), "--user") : 1; }

const Group kGroups{20, {
    {"groups paths", "13", {kUserFlag, kIdentifierFlag, {"--system", nullptr}}, {},
     "Prints \"GROUP PATH\" for each group container of a program, creating them;\n"
     "      --system for its system group containers (command 16, user 499).",
     [](G g, A a) {
       uint64_t user = userOr1(a);
       return deliver(g, [&](qk::Connection& c) {
         return a.has("--system") ? qk::systemGroupContainerPaths(c, a.value("--identifier"))
                                  : qk::groupContainerPaths(c, user, a.value("--identifier"));
       }, Output::Lines, {"ReplyGroupContainerDict"});
     }},
    {"groups ids", "14", {kUserFlag, kIdentifierFlag}, {}, "Prints the application group identifiers of a program.",
     [](G g, A a) {
       uint64_t user = userOr1(a);
       return deliver(g, [&](qk::Connection& c) { return qk::groupContainerIdentifiers(c, user, a.value("--identifier")); },
                      Output::Lines, {"ReplyGroupIdentifiersArray"});
     }},
    {"system-group-path", "17", {{"--group", "GROUP"}, kIdentifierFlag}, {"--group"},
     "Creates or looks up a system group container the caller is entitled to.",
     [](G g, A a) {
       return deliver(g, [&](qk::Connection& c) {
         return qk::systemGroupContainerPath(c, *a.value("--group"), a.value("--identifier"));
       }, Output::Value, {"ReplyPath"});
     }},
    {"codesign set", "18",
     {kIdentifierFlag, {"--entitlements", "PLIST"}, {"--cs-info", "PLIST"}, {"--remove", nullptr},
      {"--data-class", "N"}, {"--parent", "ID"}, {"--placeholder", nullptr}, {"--by-caller", nullptr}},
     {"--identifier", "--entitlements|--cs-info|--remove"},
     "Registers a program's code-signing information, given by one of: --entitlements, which\n"
     "      wraps an entitlements dictionary; --cs-info, a whole code-signing dictionary; --remove,\n"
     "      which deletes the entry and what only it kept alive.",
     [](G g, A a) {
       std::optional<plist::Value> info = codeSigningInfo(a);
       plist::Value options(codeSigningOptions(a));
       return deliver(g, [&](qk::Connection& c) {
         return qk::processCodeSigningInfo(c, a.value("--identifier"), info, options);
       });
     }},
    {"codesign get", "19", {kIdentifierFlag}, {"--identifier"}, "Prints a program's registered code-signing information.",
     [](G g, A a) {
       return deliver(g, [&](qk::Connection& c) { return qk::codeSigningInfoForIdentifier(c, a.value("--identifier")); },
                      Output::Value, {"ReplyInfoDictionary"});
     }},
    {"codesign invalidate-missing", "20", {}, {}, "Invalidates the entries of programs that have no bundle container.",
     [](G g, A) {
       return deliver(g, [](qk::Connection& c) { return qk::invalidateCodeSigningInfoForAppsWithoutBundleContainer(c); });
     }},
}};

const Registration kRegistration(kGroups);

}  // namespace

}  // namespace ctl
