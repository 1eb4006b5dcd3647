// Subcommands for group containers and the code-signing information that
// decides who may reach them.
#include <iostream>

#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

std::optional<std::string> identifierArg(A a, const char* flag = "--identifier") {
  if (auto v = a.value(flag)) return checkIdentifier(*v, flag);
  return std::nullopt;
}

uint64_t userArg(A a) { return a.has("--user") ? parseUser(*a.value("--user"), "--user") : 1; }

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
    options["com.norvane.QuarterKit.DataContainerClass"] = parseClass(*v, "--data-class");
  if (auto v = identifierArg(a, "--parent")) options["com.norvane.QuarterKit.ParentBundleID"] = *v;
  if (a.has("--placeholder")) options["com.norvane.QuarterKit.PlaceholderEntitlements"] = true;
  if (a.has("--by-caller")) options["RegByCaller"] = true;
  return options;
}

int groupPaths(G g, A a) {
  const uint64_t user = userArg(a);
  const auto identifier = identifierArg(a);
  const bool system = a.has("--system");
  return deliver(g,
                 [&](qk::Connection& c) {
                   return system ? qk::systemGroupContainerPaths(c, identifier)
                                 : qk::groupContainerPaths(c, user, identifier);
                 },
                 {[](const qk::Reply& reply) {
                    Table table({"GROUP", "PATH"});
                    if (const plist::Dictionary* d = reply.dictionary(QRTReplyKeyGroupContainerDict))
                      for (const auto& [group, path] : *d) table.add({group, plainText(path)});
                    table.print();
                  },
                  [](const qk::Reply& reply) {
                    nlohmann::json out = nlohmann::json::array();
                    if (const plist::Dictionary* d = reply.dictionary(QRTReplyKeyGroupContainerDict))
                      for (const auto& [group, path] : *d) out.push_back({{"group", group}, {"path", toJson(path)}});
                    return out;
                  }});
}

int groupIds(G g, A a) {
  const uint64_t user = userArg(a);
  const auto identifier = identifierArg(a);
  return deliver(g, [&](qk::Connection& c) { return qk::groupContainerIdentifiers(c, user, identifier); },
                 {[](const qk::Reply& reply) {
                    Table table({"GROUP"});
                    for (const std::string& group : reply.strings(QRTReplyKeyGroupIdentifiersArray)) table.add({group});
                    table.print();
                  },
                  [](const qk::Reply& reply) {
                    nlohmann::json out = nlohmann::json::array();
                    for (const std::string& group : reply.strings(QRTReplyKeyGroupIdentifiersArray))
                      out.push_back({{"group", group}});
                    return out;
                  }});
}

int systemGroupPath(G g, A a) {
  const std::string group = checkIdentifier(*a.value("--group"), "--group");
  const auto identifier = identifierArg(a);
  return deliver(
      g, [&](qk::Connection& c) { return qk::systemGroupContainerPath(c, group, identifier); },
      {[](const qk::Reply& reply) { std::cout << printable(reply.string(QRTReplyKeyPath).value_or("")) << '\n'; },
       [](const qk::Reply& reply) -> nlohmann::json {
         auto path = reply.string(QRTReplyKeyPath);
         return {{"path", path ? nlohmann::json(*path) : nlohmann::json(nullptr)}};
       }});
}

int codesignSet(G g, A a) {
  const auto identifier = identifierArg(a);
  const std::optional<plist::Value> info = codeSigningInfo(a);
  const plist::Value options(codeSigningOptions(a));
  if (info) checkMessageSize(*info, "the code-signing information");
  return deliver(g, [&](qk::Connection& c) { return qk::processCodeSigningInfo(c, identifier, info, options); });
}

int codesignGet(G g, A a) {
  const auto identifier = identifierArg(a);
  return deliver(
      g, [&](qk::Connection& c) { return qk::codeSigningInfoForIdentifier(c, identifier); },
      {[](const qk::Reply& reply) {
         Table table({"KEY", "VALUE"});
         if (const plist::Dictionary* d = reply.dictionary(QRTReplyKeyInfoDictionary))
           for (const auto& [key, value] : *d) table.add({key, plainText(value)});
         table.print();
       },
       [&](const qk::Reply& reply) -> nlohmann::json {
         const plist::Dictionary* d = reply.dictionary(QRTReplyKeyInfoDictionary);
         return {{"identifier", *identifier}, {"info", d ? toJson(plist::Value(*d)) : nlohmann::json::object()}};
       }});
}

const Flag kGroupUser{"--user", "N", "the user id (0 to 4294967294); default 1, the current mobile user"};

const Group kGroups{
    20,
    {
        {"groups paths",
         "13, 16",
         {kGroupUser, kIdentifierFlag, {"--system", nullptr, "the system group containers instead (user 499)"}},
         {},
         "Prints the group containers of a program, creating them.",
         groupPaths},
        {"groups ids",
         "14",
         {kGroupUser, kIdentifierFlag},
         {},
         "Prints the application group identifiers of a program.",
         groupIds},
        {"system-group-path",
         "17",
         {{"--group", "GROUP", "the system group identifier"}, kIdentifierFlag},
         {"--group"},
         "Prints the path of an entitled system group container.\nIt is made when missing.",
         systemGroupPath},
        {"codesign set",
         "18",
         {kIdentifierFlag,
          {"--entitlements", "PLIST", "a property-list file of entitlements to register"},
          {"--cs-info", "PLIST", "a whole code-signing dictionary to register"},
          {"--remove", nullptr, "deletes the entry and what only it kept alive"},
          {"--data-class", "CLASS", "the class of the program's data container"},
          {"--parent", "ID", "the identifier of the program that contains this one"},
          {"--placeholder", nullptr, "the entitlements of a placeholder"},
          {"--by-caller", nullptr, "registered by the program itself"}},
         {"--identifier", "--entitlements|--cs-info|--remove"},
         "Registers or removes a program's code-signing information.",
         codesignSet},
        {"codesign get",
         "19",
         {kIdentifierFlag},
         {"--identifier"},
         "Prints a program's registered code-signing information.",
         codesignGet},
        {"codesign invalidate-missing",
         "20",
         {},
         {},
         "Invalidates entries of programs without a bundle container.",
         [](G g, A) {
           return deliver(
               g, [](qk::Connection& c) { return qk::invalidateCodeSigningInfoForAppsWithoutBundleContainer(c); });
         }},
    }};

const Registration kRegistration(kGroups);

}  // namespace

}  // namespace ctl
