// Subcommands that create, find, change and remove containers.
#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;
const std::vector<std::string> kContainerKeys = {"ReplyPath", "ReplyUUID", "ReplyExisted", "ReplyIdentifier"};
// One existing container.
const std::vector<Flag> kOne = {kClassFlag, kUserFlag, kIdentifierFlag, kUUIDFlag};
const std::vector<const char*> kOneRequired = {"--class", "--identifier", "--uuid"};

int createOrLookup(G g, A a, bool create) {
  qk::ContainerRef r = containerArgs(a);
  return deliver(g, [&](qk::Connection& c) {
    return qk::createOrLookupContainer(c, r.userId, r.identifier, r.containerClass, create, a.has("--transient"));
  }, Output::Keys, kContainerKeys);
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
  return {parseUnsigned(text.substr(0, a), "--entry user"), parseUnsigned(text.substr(a + 1, b - a - 1), "--entry class"),
          parseUUID(text.substr(b + 1, c - b - 1), "--entry"), text.substr(c + 1)};
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
  return deliver(g, [&](qk::Connection& c) { return qk::stageContainerForDelete(c, users, uuids, identifiers, classes); });
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

plist::Value parseTypedValue(const std::string& text) {
  size_t colon = text.find(':');
  if (colon == std::string::npos) throw UsageError{"expected --value TYPE:VALUE, got: " + text};
  return parseTyped(text.substr(0, colon), text.substr(colon + 1), "--value");
}

int protect(G g, A a) {
  int64_t protectionClass = parseSigned(*a.value("--protection-class"), "--protection-class");
  uint64_t containerClass = a.has("--class") ? parseUnsigned(*a.value("--class"), "--class") : 2;
  uint64_t user = a.has("--user") ? parseUnsigned(*a.value("--user"), "--user") : ownerFor(containerClass);
  return deliver(g, [&](qk::Connection& c) {
    return qk::setDataProtection(c, user, a.value("--identifier"), containerClass, protectionClass,
                                 a.has("--third-party"), a.has("--retry-if-locked"));
  });
}

std::vector<Flag> with(std::vector<Flag> flags, std::initializer_list<Flag> more) {
  flags.insert(flags.end(), more);
  return flags;
}
std::vector<const char*> with(std::vector<const char*> names, std::initializer_list<const char*> more) {
  names.insert(names.end(), more);
  return names;
}

const Group kContainers{10, {
    {"create", "0", {kClassFlag, kUserFlag, kIdentifierFlag, kTransientFlag}, {"--class"},
     "Creates the container, or finds it when it exists.", [](G g, A a) { return createOrLookup(g, a, true); }},
    {"lookup", "0", {kClassFlag, kUserFlag, kIdentifierFlag, kTransientFlag}, {"--class"},
     "Finds an existing container; creates nothing.", [](G g, A a) { return createOrLookup(g, a, false); }},
    {"list", "1", {kClassFlag, kUserFlag, kTransientFlag}, {"--class"}, "Lists the containers of a class and user.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) {
         return qk::containersForUser(c, r.userId, r.containerClass, a.has("--transient"));
       }, Output::List);
     }},
    {"info get", "6", with(kOne, {{"--key", "K"}}), with(kOneRequired, {"--key"}), "Prints one info value of a container.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) { return qk::infoValueForKey(c, r, *a.value("--key")); },
                      Output::Value, {"ReplyInfoValue"});
     }},
    {"info set", "5", with(kOne, {{"--key", "K"}, {"--value", "TYPE:VALUE"}}), with(kOneRequired, {"--key"}),
     "Sets an info value (TYPE:VALUE as for raw); without --value removes the key.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       std::optional<plist::Value> value;
       if (auto text = a.value("--value")) value = parseTypedValue(*text);
       return deliver(g, [&](qk::Connection& c) { return qk::setInfoValue(c, r, *a.value("--key"), value); });
     }},
    {"metadata", "7", with(kOne, {{"--info", nullptr}}), kOneRequired,
     "Prints a container's path and transient flag; --info adds its info dictionary.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) { return qk::metadataForContainer(c, r, a.has("--info")); },
                      Output::Keys, {"ReplyPath", "ReplyTransient", "ReplyInfoDictionary"});
     }},
    {"recreate", "8", kOne, kOneRequired, "Creates the container's default sub-directories again.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) { return qk::recreateDefaultStructure(c, r); });
     }},
    {"recreate-structure", "22", kOne, kOneRequired, "The same as recreate, through its second command number.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) { return qk::recreateContainerStructure(c, r); });
     }},
    {"regenerate-uuid", "9", kOne, kOneRequired, "Gives the container's directory a new name; the internal UUID stays.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) { return qk::regenerateDirectoryUUID(c, r); });
     }},
    {"delete", "10", {kClassFlag, kUserFlag, kIdentifierFlag, kTransientFlag}, {"--class", "--identifier"},
     "Stages a container for deletion (see deathrow).",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) {
         return qk::deleteContainer(c, r.userId, r.identifier, r.containerClass, a.has("--transient"));
       });
     }},
    {"stage", "3", {{"--entry", "USER:CLASS:UUID:IDENTIFIER"}}, {"--entry"},
     "Stages containers for deletion, one --entry per container (repeat it).", stage},
    {"wipe", "12", {kClassFlag, kUserFlag, kIdentifierFlag, {"--addon", nullptr}}, {"--identifier"},
     "Replaces a data container's content by fresh content; --addon wipes a\n"
     "      class 4 container under the wipeContainer entitlement (command 11), with no --class.", wipe},
    {"replace", "2",
     {{"--old-uuid", "UUID"}, {"--old-class", "N"}, {"--old-user", "N"}, {"--old-identifier", "ID"},
      {"--new-uuid", "UUID"}, {"--new-class", "N"}, {"--new-user", "N"}, {"--new-identifier", "ID"}},
     {"--new-class"},
     "Puts the new container in the old one's place; without --old-uuid it\n"
     "      makes a transient container permanent.", replace},
    {"deathrow", "4", {}, {}, "Destroys everything staged for deletion; answers when the pass is done.",
     [](G g, A) { return deliver(g, [](qk::Connection& c) { return qk::deleteContainersOnDeathRow(c); }); }},
    {"du", "23", kOne, kOneRequired, "Prints the bytes a container uses.",
     [](G g, A a) {
       qk::ContainerRef r = containerArgs(a);
       return deliver(g, [&](qk::Connection& c) { return qk::diskUsage(c, r); }, Output::Value, {"ReplyDiskUsage"});
     }},
    {"system-path", "15", {kIdentifierFlag}, {}, "Creates or looks up a system container (class 12, user 499).",
     [](G g, A a) {
       return deliver(g, [&](qk::Connection& c) { return qk::systemContainerPath(c, a.value("--identifier")); },
                      Output::Keys, kContainerKeys);
     }},
    {"protect", "21",
     {kIdentifierFlag, {"--protection-class", "N"}, kClassFlag, kUserFlag, {"--third-party", nullptr},
      {"--retry-if-locked", nullptr}},
     {"--identifier", "--protection-class"},
     "Sets the protection class of every item of a data container's Documents,\n"
     "      Library, tmp and Purchases (--class defaults to 2). The reply comes when the change is\n"
     "      done; with --retry-if-locked a locked device holds it until the next unlock.", protect},
}};

const Registration kRegistration(kContainers);

}  // namespace

}  // namespace ctl
