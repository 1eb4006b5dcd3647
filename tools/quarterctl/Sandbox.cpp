// Subcommands of the services around the sandbox: shared content, the
// network extension, user-managed assets, the data migration and the retry test.
#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

const Group kSandbox{30, {
    {"migrate", "24", {}, {}, "Runs the data migration: ACLs, bundle ownership and the code-signing imports, each once.",
     [](G g, A) { return deliver(g, [](qk::Connection& c) { return qk::performDataMigration(c); }); }},
    {"retry-test", "25", {kUserFlag, {"--crashes", "N"}}, {},
     "Internal builds: ends the daemon --crashes times, then removes the test container.",
     [](G g, A a) {
       uint64_t user = a.has("--user") ? parseUnsigned(*a.value("--user"), "--user") : ownerFor(2);
       uint64_t crashes = a.has("--crashes") ? parseUnsigned(*a.value("--crashes"), "--crashes") : 0;
       return deliver(g, [&](qk::Connection& c) { return qk::retryTest(c, user, crashes); });
     }},
    {"stage-shared", "26", {kIdentifierFlag, {"--source", "PATH"}, {"--dest", "PATH"}},
     {"--identifier", "--source", "--dest"}, "Moves --source to --dest inside a system group container.",
     [](G g, A a) {
       return deliver(g, [&](qk::Connection& c) {
         return qk::stageSharedContent(c, a.value("--identifier"), a.value("--source"), a.value("--dest"));
       }, Output::Keys, {"ReplyPath"});
     }},
    {"network-extension", "27", {kIdentifierFlag, kClassFlag}, {"--identifier", "--class"},
     "Makes a VPN plug-in's data container and maps it for the tunnel worker.",
     [](G g, A a) {
       uint64_t containerClass = parseUnsigned(*a.value("--class"), "--class");
       return deliver(g, [&](qk::Connection& c) {
         return qk::setNetworkExtension(c, a.value("--identifier"), containerClass);
       });
     }},
    {"assets-path", "28", {kIdentifierFlag, {"--relative", nullptr}}, {"--identifier"},
     "Prints (making it on first use) an application's user-managed assets directory.",
     [](G g, A a) {
       return deliver(g, [&](qk::Connection& c) {
         return qk::userManagedAssetsPath(c, a.value("--identifier"), a.has("--relative"));
       }, Output::Keys, {"ReplyPath"});
     }},
    {"assets-delete", "29", {kIdentifierFlag, {"--source", "PATH"}}, {"--identifier", "--source"},
     "Moves one user-managed asset (--source, relative to the assets directory) to death row.",
     [](G g, A a) {
       return deliver(g, [&](qk::Connection& c) {
         return qk::deleteUserManagedAsset(c, a.value("--identifier"), a.value("--source"));
       });
     }},
}};

const Registration kRegistration(kSandbox);

}  // namespace

}  // namespace ctl
