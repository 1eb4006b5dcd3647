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
  checkMessageSize(plist::Value(request), "the request");
  return deliver(g, [&](qk::Connection& c) { return qk::perform(c, qk::Request(std::move(request))); });
}

const Group kRaw{0,
                 {
                     {"raw",
                      "any",
                      {{"--file", "FILE", "a property list (binary or XML) whose dictionary is the request"}},
                      {},
                      "Sends any request and prints every key of the reply.\n"
                      "KEY=TYPE:VALUE words are added to the request (and replace the file's keys). TYPE is\n"
                      "  u64     unsigned integer, decimal or 0x-hex\n"
                      "  i64     signed integer, decimal or 0x-hex\n"
                      "  bool    true or false\n"
                      "  str     a string, taken as is\n"
                      "  uuid    a UUID in text form, sent as 16-byte data\n"
                      "  data    hex bytes, sent as data\n"
                      "  plist   path of a property-list file, whose value is sent\n"
                      "Without a \"Command\" key the daemon takes command 0. Example:\n"
                      "  quarterctl raw Command=u64:1 UserID=u64:501 ContainerClass=u64:2",
                      raw,
                      "[KEY=TYPE:VALUE ...]"},
                 }};

const Registration kRegistration(kRaw);

}  // namespace

}  // namespace ctl
