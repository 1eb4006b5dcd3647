// Subcommands of the services around the sandbox: shared content, the
// network extension, user-managed assets, the data migration and the retry test.
#include <iostream>

#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

std::optional<std::string> identifierArg(A a) {
  if (auto v = a.value("--identifier")) return checkIdentifier(*v, "--identifier");
  return std::nullopt;
}

// Shows the reply's path alone, or as {"path": ...}.
const Show kPath = {
    [](const qk::Reply& reply) { std::cout << printable(reply.string(QRTReplyKeyPath).value_or("")) << '\n'; },
    [](const qk::Reply& reply) -> nlohmann::json {
      auto path = reply.string(QRTReplyKeyPath);
      return {{"path", path ? nlohmann::json(*path) : nlohmann::json(nullptr)}};
    }};

const Group kSandbox{
    30,
    {
        {"migrate",
         "24",
         {},
         {},
         "Runs the data migration.\nACLs, bundle ownership and the code-signing imports, each once.",
         [](G g, A) { return deliver(g, [](qk::Connection& c) { return qk::performDataMigration(c); }); }},
        {"retry-test",
         "25",
         {{"--user", "N", "the test container's user (default 1)"},
          {"--crashes", "N", "how many times the daemon ends"}},
         {},
         "Internal builds: tests the recovery of interrupted work.\nEnds the daemon --crashes times, then removes the "
         "test container.",
         [](G g, A a) {
           uint64_t user = a.has("--user") ? parseUser(*a.value("--user"), "--user") : ownerFor(2);
           uint64_t crashes = a.has("--crashes") ? parseUnsigned(*a.value("--crashes"), "--crashes") : 0;
           return deliver(g, [&](qk::Connection& c) { return qk::retryTest(c, user, crashes); });
         }},
        {"stage-shared",
         "26",
         {kIdentifierFlag,
          {"--source", "PATH", "relative to the system group container"},
          {"--dest", "PATH", "relative to the system group container"}},
         {"--identifier", "--source", "--dest"},
         "Moves --source to --dest inside a system group container.",
         [](G g, A a) {
           const auto identifier = identifierArg(a);
           return deliver(
               g,
               [&](qk::Connection& c) {
                 return qk::stageSharedContent(c, identifier, a.value("--source"), a.value("--dest"));
               },
               kPath);
         }},
        {"network-extension",
         "27",
         {kIdentifierFlag, kClassFlag},
         {"--identifier", "--class"},
         "Makes a VPN plug-in's data container for the tunnel worker.",
         [](G g, A a) {
           const auto identifier = identifierArg(a);
           const uint64_t containerClass = parseClass(*a.value("--class"), "--class");
           return deliver(g, [&](qk::Connection& c) { return qk::setNetworkExtension(c, identifier, containerClass); });
         }},
        {"assets-path",
         "28",
         {kIdentifierFlag, {"--relative", nullptr, "the path relative to the data container"}},
         {"--identifier"},
         "Prints an application's user-managed assets directory.\nIt is made on first use.",
         [](G g, A a) {
           const auto identifier = identifierArg(a);
           return deliver(
               g, [&](qk::Connection& c) { return qk::userManagedAssetsPath(c, identifier, a.has("--relative")); },
               kPath);
         }},
        {"assets-delete",
         "29",
         {kIdentifierFlag, {"--source", "PATH", "the asset, relative to the assets directory"}},
         {"--identifier", "--source"},
         "Moves one user-managed asset to death row.",
         [](G g, A a) {
           const auto identifier = identifierArg(a);
           return deliver(
               g, [&](qk::Connection& c) { return qk::deleteUserManagedAsset(c, identifier, a.value("--source")); });
         }},
    }};

const Registration kRegistration(kSandbox);

}  // namespace

}  // namespace ctl
