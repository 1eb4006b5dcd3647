// Any request, built from a property-list file and KEY=TYPE:VALUE words.
#include "Cli.h"

namespace ctl {

namespace {

int raw(const Global& g, const Args& a) {
  plist::Dictionary request;
  for (const auto& [flag, path] : a.given) {
    plist::Value file = readDictionaryFile(path);
    for (auto& [k, v] : file.dictionary()) request.insert_or_assign(k, v);
  }
  for (const std::string& word : a.words) addAssignment(word, request);
  return deliver(g, [&](qk::Connection& c) { return qk::perform(c, qk::Request(std::move(request))); });
}

const Group kRaw{0, {
    {"raw", "any", {{"--file", "FILE"}}, {},
     "Sends any request. FILE is a property list (binary or XML) whose top-level dictionary\n"
     "      is the request; KEY=TYPE:VALUE pairs are added to it (and replace its keys). TYPE is\n"
     "        u64     unsigned integer, decimal or 0x-hex\n"
     "        i64     signed integer, decimal or 0x-hex\n"
     "        bool    true or false\n"
     "        str     a string, taken as is\n"
     "        uuid    a UUID in text form, sent as 16-byte data\n"
     "        data    hex bytes, sent as data\n"
     "        plist   path of a property-list file, whose value is sent\n"
     "      Without a \"Command\" key the daemon takes command 0. Example:\n"
     "        quarterctl raw Command=u64:1 UserID=u64:501 ContainerClass=u64:2",
     raw, true},
}};

const Registration kRegistration(kRaw);

}  // namespace

}  // namespace ctl
