// quarterctl: sends requests to quarterd and prints the replies, for people
// and for scripts (--json). Exit status: 0 success, 1 the daemon answered
// with an error, 2 usage or connection trouble.
#include <getopt.h>

#include <algorithm>
#include <cstdlib>
#include <iostream>
#include <string>
#include <vector>

#include "Cli.h"

namespace ctl {

std::vector<const Group*>& registry() {
  static std::vector<const Group*> groups;
  return groups;
}

const std::vector<const Group*>& groups() { return registry(); }

Registration::Registration(const Group& group) {
  auto& all = registry();
  all.insert(std::upper_bound(all.begin(), all.end(), &group,
                              [](const Group* a, const Group* b) { return a->order < b->order; }),
             &group);
}

namespace {

const char kUsageHead[] = R"(usage: quarterctl [--root DIR | --socket PATH] [--json] [--timeout SECONDS] COMMAND ...

Sends one request to quarterd and prints its reply.

Options:
  --root DIR         talk to the daemon of device root DIR (socket DIR/run/com.norvane.quarterd);
                     without --root and --socket, the root comes from QUARTERD_ROOT, else /
  --socket PATH      talk to the request socket at PATH
  --json             print the whole reply as a JSON object: integers as numbers, 16-byte data
                     as UUID strings, other data as base64 strings, dates as ISO 8601 strings
  --timeout SECONDS  how long to wait for the reply (default 60)
  -h, --help         this text
  -V, --version      the version

Commands:
)";

const char kUsageTail[] = R"(
--user defaults to the owner the class demands: 33 for the bundle classes 1, 3, 5 and 8,
499 for classes 12 and 13, otherwise 1 (the current mobile user). --uuid is the container's
internal UUID, as create and lookup print it. create, lookup and system-path take the
caller's own identifier when --identifier is missing.

Output: create, lookup, system-path and metadata print "Key: value" lines for the reply keys
they are about; list prints "IDENTIFIER UUID" per container; info get, du, system-group-path
and codesign get print the value alone; groups prints one line per group; the others, and raw,
print every other reply key, sorted, then "ok". 16-byte data is shown as a UUID and nested
values in the old-style property-list text form. A failure is reported on standard error
with its code and what it means: quarterctl: error 21 (no such container).

Exit status: 0 when the reply's ReplyError is 1, 1 when it is another value, 2 on usage
errors, connection failures and when no reply came.
)";

bool isRequired(const Subcommand& row, const char* flag) {
  for (std::string_view names : row.required)
    if (names == flag) return true;
  return false;
}

std::string usageText() {
  std::string out = kUsageHead;
  for (const Group* group : groups())
    for (const Subcommand& row : group->subcommands) {
      std::string line = "  " + std::string(row.name);
      if (row.words) line += " [--file FILE] [KEY=TYPE:VALUE ...]";
      for (const Flag& flag : row.flags) {
        if (row.words) break;
        std::string option = flag.name;
        if (flag.value) option += std::string(" ") + flag.value;
        option = isRequired(row, flag.name) ? " " + option : " [" + option + "]";
        if (line.size() + option.size() > 92) {
          out += line + '\n';
          line = "       ";
        }
        line += option;
      }
      out += line + "\n      (command " + row.commands + ") " + row.help + '\n';
    }
  return out + kUsageTail;
}

// The subcommand named by the first one or two words; *words says how many.
const Subcommand* findSubcommand(const std::vector<std::string>& args, size_t* words) {
  for (const Group* group : groups())
    for (const Subcommand& row : group->subcommands) {
      std::string_view name = row.name;
      size_t space = name.find(' ');
      if (space == std::string_view::npos ? args[0] == name
                                          : args.size() > 1 && args[0] == name.substr(0, space) &&
                                                args[1] == name.substr(space + 1)) {
        *words = space == std::string_view::npos ? 1 : 2;
        return &row;
      }
    }
  return nullptr;
}

Args parseArgs(const Subcommand& row, const std::vector<std::string>& args, size_t first) {
  Args a;
  std::vector<LongOption> longs;
  constexpr int kBase = 1000;
  for (size_t i = 0; i < row.flags.size(); ++i)
    longs.push_back({row.flags[i].name + 2, row.flags[i].value != nullptr, kBase + static_cast<int>(i)});
  parseLong(args, first, longs, row.name, row.words, [&](int c, const char* value) {
    if (c == 1) return a.words.push_back(value);
    a.given.emplace_back(row.flags[static_cast<size_t>(c - kBase)].name, value ? value : "");
  });
  for (std::string_view names : row.required) {
    bool found = false;
    for (size_t at = 0; at <= names.size() && !found;) {
      size_t bar = std::min(names.find('|', at), names.size());
      found = a.has(names.substr(at, bar - at));
      at = bar + 1;
    }
    if (!found) throw UsageError{std::string(row.name) + " needs " + std::string(names.substr(0, names.find('|')))};
  }
  return a;
}

// Global options stop at the first word that is not one.
Global parseOptions(int argc, char** argv, bool* help, bool* version) {
  Global options;
  options.socketPath = qk::requestSocketPath("/");
  if (const char* root = getenv("QUARTERD_ROOT"); root && *root) options.socketPath = qk::requestSocketPath(root);
  enum { kRoot = 1000, kSocket, kJson, kTimeout };
  static const option kLong[] = {
      {"root", required_argument, nullptr, kRoot}, {"socket", required_argument, nullptr, kSocket},
      {"json", no_argument, nullptr, kJson},       {"timeout", required_argument, nullptr, kTimeout},
      {"help", no_argument, nullptr, 'h'},         {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  opterr = 0;
  for (int c; (c = getopt_long(argc, argv, "+:hV", kLong, nullptr)) != -1;) {
    switch (c) {
      case kRoot: options.socketPath = qk::requestSocketPath(optarg); break;
      case kSocket: options.socketPath = optarg; break;
      case kJson: options.json = true; break;
      case kTimeout: options.timeout = std::chrono::seconds(parseUnsigned(optarg, "--timeout")); break;
      case 'h': *help = true; break;
      case 'V': *version = true; break;
      case ':': throw UsageError{std::string(argv[optind - 1]) + " needs a value"};
      default: throw UsageError{"unknown option " + std::string(argv[optind - 1])};
    }
  }
  options.args.assign(argv + optind, argv + argc);
  return options;
}

int run(int argc, char** argv) {
  bool help = false, version = false;
  Global options = parseOptions(argc, argv, &help, &version);
  if (version) {
    std::cout << "quarterctl " << QRT_VERSION << '\n';
    return kExitOK;
  }
  if (help) {
    std::cout << usageText();
    return kExitOK;
  }
  if (options.args.empty()) throw UsageError{"no command given"};
  const std::string& command = options.args[0];
  if (command == "help" || std::any_of(options.args.begin(), options.args.end(),
                                       [](const std::string& a) { return a == "-h" || a == "--help"; })) {
    std::cout << usageText();
    return kExitOK;
  }
  size_t words = 0;
  if (const Subcommand* row = findSubcommand(options.args, &words))
    return row->run(options, parseArgs(*row, options.args, words));
  if (command == "info") throw UsageError{"info needs get or set"};
  throw UsageError{"unknown command " + command};
}

}  // namespace

}  // namespace ctl

int main(int argc, char** argv) {
  try {
    return ctl::run(argc, argv);
  } catch (const ctl::UsageError& e) {
    std::cerr << "quarterctl: " << e.message << "\n(quarterctl --help for usage)\n";
  } catch (const std::exception& e) {
    std::cerr << "quarterctl: " << e.what() << '\n';
  }
  return ctl::kExitUsage;
}
