// Subcommands that create, find, change and remove containers.
#include <deque>
#include <future>
#include <iostream>

#include "Cli.h"
#include "base/PlistCodec.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

// What the metadata file holds at most, info values included.
constexpr size_t kMaxMetadata = 1u << 20;
// List look-ups in flight at once; the daemon serves a bounded number per connection.
constexpr size_t kPathWindow = 64;

const Flag kKeyFlag{"--key", "K", "the info value's key"};
// One existing container.
const std::vector<Flag> kOne = {kClassFlag, kUserFlag, kIdentifierFlag, kUUIDFlag};
const std::vector<const char*> kOneRequired = {"--class", "--identifier"};

std::vector<Flag> with(std::vector<Flag> flags, std::initializer_list<Flag> more) {
  flags.insert(flags.end(), more);
  return flags;
}

std::string uuidText(const std::optional<QRTUUID>& uuid) { return uuid ? uuid->UUIDString() : ""; }
nlohmann::json orNull(const std::optional<std::string>& s) { return s ? nlohmann::json(*s) : nlohmann::json(nullptr); }

// Runs op on the container r names once its UUID is known.
qk::Result onOne(qk::Connection& c, qk::ContainerRef& r, const std::function<qk::Result()>& op) {
  qk::Result found = resolve(c, r);
  return found && found->ok() ? op() : found;
}

int createOrLookup(G g, A a, bool create) {
  qk::ContainerRef r = containerArgs(a);
  const bool transient = a.has("--transient");
  return deliver(
      g,
      [&](qk::Connection& c) {
        return qk::createOrLookupContainer(c, r.userId, r.identifier, r.containerClass, create, transient);
      },
      {[](const qk::Reply& reply) {
         Table table({"IDENTIFIER", "UUID", "EXISTED", "PATH"});
         table.add({reply.string(QRTReplyKeyIdentifier).value_or(""), uuidText(reply.uuid(QRTReplyKeyUUID)),
                    reply.boolean(QRTReplyKeyExisted) ? "yes" : "no", reply.string(QRTReplyKeyPath).value_or("")});
         table.print();
       },
       [](const qk::Reply& reply) -> nlohmann::json {
         return {{"identifier", orNull(reply.string(QRTReplyKeyIdentifier))},
                 {"uuid", uuidText(reply.uuid(QRTReplyKeyUUID))},
                 {"path", orNull(reply.string(QRTReplyKeyPath))},
                 {"existed", reply.boolean(QRTReplyKeyExisted)}};
       }});
}

// The path of each listed container, asked for with a window of requests in
// flight; nothing for one that went away meanwhile.
std::vector<std::optional<std::string>> pathsOf(qk::Connection& c, const qk::ContainerRef& base,
                                                const std::vector<std::string>& ids,
                                                const std::vector<QRTUUID>& uuids) {
  std::vector<std::optional<std::string>> paths;
  std::deque<std::future<std::optional<plist::Dictionary>>> pending;
  auto collect = [&] {
    std::optional<plist::Dictionary> reply;
    if (pending.front().wait_for(c.replyTimeout()) == std::future_status::ready) reply = pending.front().get();
    pending.pop_front();
    paths.push_back(reply ? qk::Reply(std::move(*reply)).string(QRTReplyKeyPath) : std::nullopt);
  };
  for (size_t i = 0; i < std::min(ids.size(), uuids.size()); ++i) {
    pending.push_back(c.send(qk::Request(qk::Command::metadataForContainer)
                                 .u64(QRTKeyUserID, base.userId)
                                 .u64(QRTKeyContainerClass, base.containerClass)
                                 .string(QRTKeyIdentifier, ids[i])
                                 .uuid(QRTKeyUUID, uuids[i])
                                 .message()));
    if (pending.size() >= kPathWindow) collect();
  }
  while (!pending.empty()) collect();
  return paths;
}

int list(G g, A a) {
  qk::ContainerRef r = containerArgs(a);
  const bool transient = a.has("--transient");
  std::vector<std::string> ids;
  std::vector<QRTUUID> uuids;
  std::vector<std::optional<std::string>> paths;
  return deliver(
      g,
      [&](qk::Connection& c) {
        qk::Result reply = qk::containersForUser(c, r.userId, r.containerClass, transient);
        if (reply && reply->ok()) {
          ids = reply->strings(QRTReplyKeyIdsArray);
          uuids = reply->uuids(QRTReplyKeyUUIDsArray);
          paths = pathsOf(c, r, ids, uuids);
        }
        return reply;
      },
      {[&](const qk::Reply&) {
         Table table({"IDENTIFIER", "UUID", "PATH"});
         for (size_t i = 0; i < paths.size(); ++i) table.add({ids[i], uuids[i].UUIDString(), paths[i].value_or("-")});
         table.print();
       },
       [&](const qk::Reply&) {
         nlohmann::json out = nlohmann::json::array();
         for (size_t i = 0; i < paths.size(); ++i)
           out.push_back({{"identifier", ids[i]}, {"uuid", uuids[i].UUIDString()}, {"path", orNull(paths[i])}});
         return out;
       }});
}

int infoGet(G g, A a) {
  qk::ContainerRef r = containerArgs(a);
  const std::string key = *a.value("--key");
  return deliver(g, [&](qk::Connection& c) { return onOne(c, r, [&] { return qk::infoValueForKey(c, r, key); }); },
                 {[](const qk::Reply& reply) {
                    const plist::Value* v = reply.value(QRTReplyKeyInfoValue);
                    std::cout << printable(v ? plainText(*v) : "") << '\n';
                  },
                  [&](const qk::Reply& reply) -> nlohmann::json {
                    const plist::Value* v = reply.value(QRTReplyKeyInfoValue);
                    return {{"key", key}, {"value", v ? toJson(*v) : nlohmann::json(nullptr)}};
                  }});
}

int infoSet(G g, A a) {
  qk::ContainerRef r = containerArgs(a);
  const std::string key = *a.value("--key");
  std::optional<plist::Value> value;
  if (auto text = a.value("--value")) {
    size_t colon = text->find(':');
    if (colon == std::string::npos) throw UsageError{"expected --value TYPE:VALUE, got: " + *text};
    value = parseTyped(text->substr(0, colon), text->substr(colon + 1), "--value");
    if (plist::writeBinary(*value).size() > kMaxMetadata)
      throw UsageError{"value larger than the 1 MiB limit of a container's metadata"};
  }
  Show show;
  show.hints = {{38, "a container's metadata, every info value included, holds at most 1 MiB"}};
  return deliver(
      g, [&](qk::Connection& c) { return onOne(c, r, [&] { return qk::setInfoValue(c, r, key, value); }); }, show);
}

int metadata(G g, A a) {
  qk::ContainerRef r = containerArgs(a);
  const bool info = a.has("--info");
  return deliver(
      g, [&](qk::Connection& c) { return onOne(c, r, [&] { return qk::metadataForContainer(c, r, info); }); },
      {[&](const qk::Reply& reply) {
         Table table({"IDENTIFIER", "UUID", "TRANSIENT", "PATH"});
         table.add({r.identifier.value_or(""), uuidText(r.uuid), reply.boolean(QRTReplyKeyTransient) ? "yes" : "no",
                    reply.string(QRTReplyKeyPath).value_or("")});
         table.print();
         if (!info) return;
         std::cout << '\n';
         Table values({"KEY", "VALUE"});
         if (const plist::Dictionary* d = reply.dictionary(QRTReplyKeyInfoDictionary))
           for (const auto& [k, v] : *d) values.add({k, plainText(v)});
         values.print();
       },
       [&](const qk::Reply& reply) {
         nlohmann::json out = {{"identifier", orNull(r.identifier)},
                               {"uuid", uuidText(r.uuid)},
                               {"path", orNull(reply.string(QRTReplyKeyPath))},
                               {"transient", reply.boolean(QRTReplyKeyTransient)}};
         if (info) {
           const plist::Dictionary* d = reply.dictionary(QRTReplyKeyInfoDictionary);
           out["info"] = d ? toJson(plist::Value(*d)) : nlohmann::json::object();
         }
         return out;
       }});
}

int du(G g, A a) {
  qk::ContainerRef r = containerArgs(a);
  const bool units = a.has("--human-readable");
  return deliver(
      g, [&](qk::Connection& c) { return onOne(c, r, [&] { return qk::diskUsage(c, r); }); },
      {[&](const qk::Reply& reply) {
         Table table({"IDENTIFIER", "UUID", "SIZE"});
         table.add({r.identifier.value_or(""), uuidText(r.uuid), sizeText(reply.u64(QRTReplyKeyDiskUsage), units)});
         table.print();
       },
       [&](const qk::Reply& reply) -> nlohmann::json {
         return {{"identifier", orNull(r.identifier)},
                 {"uuid", uuidText(r.uuid)},
                 {"bytes", reply.u64(QRTReplyKeyDiskUsage)}};
       }});
}

// Runs a command with no reply keys on one container.
template <qk::Result (*op)(qk::Connection&, const qk::ContainerRef&)>
int onContainer(G g, A a) {
  qk::ContainerRef r = containerArgs(a);
  return deliver(g, [&](qk::Connection& c) { return onOne(c, r, [&] { return op(c, r); }); });
}

// The USER:CLASS:UUID:IDENTIFIER of --entry; the identifier is the rest, colons and all.
struct StageEntry {
  uint64_t userId = 0, containerClass = 0;
  QRTUUID uuid;
  std::string identifier;
};

StageEntry parseEntry(const std::string& text) {
  size_t a = text.find(':');
  size_t b = a == std::string::npos ? a : text.find(':', a + 1);
  size_t c = b == std::string::npos ? b : text.find(':', b + 1);
  if (c == std::string::npos) throw UsageError{"expected USER:CLASS:UUID:IDENTIFIER, got: " + text};
  return {parseUser(text.substr(0, a), "--entry user"), parseClass(text.substr(a + 1, b - a - 1), "--entry class"),
          parseUUID(text.substr(b + 1, c - b - 1), "--entry"),
          checkIdentifier(text.substr(c + 1), "--entry identifier")};
}

int stage(G g, A a) {
  std::vector<uint64_t> users, classes;
  std::vector<QRTUUID> uuids;
  std::vector<std::string> identifiers;
  for (const std::string& text : a.values("--entry")) {
    StageEntry e = parseEntry(text);
    users.push_back(e.userId);
    classes.push_back(e.containerClass);
    uuids.push_back(e.uuid);
    identifiers.push_back(e.identifier);
  }
  return deliver(g,
                 [&](qk::Connection& c) { return qk::stageContainerForDelete(c, users, uuids, identifiers, classes); });
}

int wipe(G g, A a) {
  const bool addon = a.has("--addon");
  if (!addon && !a.has("--class")) throw UsageError{"wipe needs --class"};
  qk::ContainerRef r = containerArgs(a);
  if (addon) {
    uint64_t user = a.has("--user") ? r.userId : ownerFor(4);
    return deliver(g, [&](qk::Connection& c) { return qk::wipeAddonDataContainer(c, user, r.identifier); });
  }
  return deliver(g, [&](qk::Connection& c) {
    return qk::deleteDataContainerContent(c, r.userId, r.identifier, r.containerClass);
  });
}

int replace(G g, A a) {
  bool hasOld = a.has("--old-uuid") || a.has("--old-class") || a.has("--old-user") || a.has("--old-identifier");
  std::optional<qk::ContainerRef> old;
  if (hasOld) old = containerArgs(a, "--old-");
  qk::ContainerRef replacement = containerArgs(a, "--new-");
  return deliver(g, [&](qk::Connection& c) { return qk::replaceContainer(c, old, replacement); });
}

int protect(G g, A a) {
  const std::string text = *a.value("--protection-class");
  int64_t protectionClass = parseSigned(text, "--protection-class");
  if (protectionClass < 0 || protectionClass > 4)
    throw UsageError{"--protection-class " + text + " is out of range: protection classes are 0 to 4"};
  uint64_t containerClass = a.has("--class") ? parseClass(*a.value("--class"), "--class") : 2;
  uint64_t user = a.has("--user") ? parseUser(*a.value("--user"), "--user") : ownerFor(containerClass);
  std::optional<std::string> identifier = checkIdentifier(*a.value("--identifier"), "--identifier");
  return deliver(g, [&](qk::Connection& c) {
    return qk::setDataProtection(c, user, identifier, containerClass, protectionClass, a.has("--third-party"),
                                 a.has("--retry-if-locked"));
  });
}

int systemPath(G g, A a) {
  std::optional<std::string> identifier;
  if (auto v = a.value("--identifier")) identifier = checkIdentifier(*v, "--identifier");
  return deliver(
      g, [&](qk::Connection& c) { return qk::systemContainerPath(c, identifier); },
      {[](const qk::Reply& reply) { std::cout << printable(reply.string(QRTReplyKeyPath).value_or("")) << '\n'; },
       [](const qk::Reply& reply) -> nlohmann::json {
         return {{"path", orNull(reply.string(QRTReplyKeyPath))}};
       }});
}

const Group kContainers{
    10,
    {
        {"create",
         "0",
         {kClassFlag, kUserFlag, kIdentifierFlag, kTransientFlag},
         {"--class"},
         "Creates the container, or finds it when it exists.\nWithout --identifier, the caller's own.",
         [](G g, A a) { return createOrLookup(g, a, true); }},
        {"lookup",
         "0",
         {kClassFlag, kUserFlag, kIdentifierFlag, kTransientFlag},
         {"--class"},
         "Finds an existing container; creates nothing.",
         [](G g, A a) { return createOrLookup(g, a, false); }},
        {"list",
         "1, 7",
         {kClassFlag, kUserFlag, kTransientFlag},
         {"--class"},
         "Lists the containers of a class and user, with their paths.",
         list},
        {"info get",
         "6",
         with(kOne, {kKeyFlag}),
         {"--class", "--identifier", "--key"},
         "Prints one info value of a container.",
         infoGet},
        {"info set",
         "5",
         with(kOne, {kKeyFlag, {"--value", "TYPE:VALUE", "the value, typed as for raw; left out, the key goes"}}),
         {"--class", "--identifier", "--key"},
         "Sets an info value of a container, or removes it.",
         infoSet},
        {"metadata", "7", with(kOne, {{"--info", nullptr, "adds the container's info values"}}), kOneRequired,
         "Prints a container's path and transient flag.", metadata},
        {"recreate", "8", kOne, kOneRequired, "Creates the container's default sub-directories again.",
         onContainer<qk::recreateDefaultStructure>},
        {"recreate-structure", "22", kOne, kOneRequired, "The same as recreate, through its second command number.",
         onContainer<qk::recreateContainerStructure>},
        {"regenerate-uuid", "9", kOne, kOneRequired,
         "Gives the container's directory a new name.\nThe internal UUID stays.",
         onContainer<qk::regenerateDirectoryUUID>},
        {"delete",
         "10",
         {kClassFlag, kUserFlag, kIdentifierFlag, kTransientFlag},
         {"--class", "--identifier"},
         "Stages a container for deletion (see deathrow).",
         [](G g, A a) {
           qk::ContainerRef r = containerArgs(a);
           const bool transient = a.has("--transient");
           return deliver(g, [&](qk::Connection& c) {
             return qk::deleteContainer(c, r.userId, r.identifier, r.containerClass, transient);
           });
         }},
        {"stage",
         "3",
         {{"--entry", "USER:CLASS:UUID:IDENTIFIER", "one container; repeat it for more"}},
         {"--entry"},
         "Stages containers for deletion, one --entry per container.",
         stage},
        {"wipe",
         "12, 11",
         {kClassFlag,
          kUserFlag,
          kIdentifierFlag,
          {"--addon", nullptr, "wipes an addon-data container under the wipeContainer entitlement; no --class"}},
         {"--identifier"},
         "Replaces a data container's content by fresh content.",
         wipe},
        {"replace",
         "2",
         {{"--old-uuid", "UUID", "the container replaced"},
          {"--old-class", "CLASS", "its class"},
          {"--old-user", "N", "its user"},
          {"--old-identifier", "ID", "its identifier"},
          {"--new-uuid", "UUID", "the container that takes its place"},
          {"--new-class", "CLASS", "its class"},
          {"--new-user", "N", "its user"},
          {"--new-identifier", "ID", "its identifier"}},
         {"--new-class"},
         "Puts the new container in the old one's place.\n"
         "Without --old-uuid it makes a transient container permanent.",
         replace},
        {"deathrow",
         "4",
         {},
         {},
         "Destroys everything staged for deletion.\nThe answer comes when the pass is done.",
         [](G g, A) { return deliver(g, [](qk::Connection& c) { return qk::deleteContainersOnDeathRow(c); }); }},
        {"du", "23", with(kOne, {{"--human-readable", nullptr, "-h: sizes in KiB, MiB, GiB (powers of 1024)"}}),
         kOneRequired, "Prints the bytes a container uses.", du},
        {"system-path",
         "15",
         {kIdentifierFlag},
         {},
         "Creates or looks up a system container and prints its path.",
         systemPath},
        {"protect",
         "21",
         {kIdentifierFlag,
          {"--protection-class", "N", "the protection class, 0 to 4 (the daemon refuses 2)"},
          {"--class", "CLASS", "the data container's class (default app-data)"},
          kUserFlag,
          {"--third-party", nullptr, "the program is not built in: only 0, 1 and 3"},
          {"--retry-if-locked", nullptr, "a locked device holds the change until the next unlock"}},
         {"--identifier", "--protection-class"},
         "Sets the protection class of a data container's items.\n"
         "Every item of its Documents, Library, tmp and Purchases; the answer comes when the change\n"
         "is done.",
         protect},
    }};

const Registration kRegistration(kContainers);

}  // namespace

}  // namespace ctl
