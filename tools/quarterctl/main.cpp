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

namespace {

std::vector<const Group*>& registry() {
  static std::vector<const Group*> groups;
  return groups;
}

}  // namespace

const std::vector<const Group*>& groups() { return registry(); }

Registration::Registration(const Group& group) {
  auto& all = registry();
  all.insert(std::upper_bound(all.begin(), all.end(), &group,
                              [](const Group* a, const Group* b) { return a->order < b->order; }),
             &group);
}

namespace {

const char kUsageHead[] =
    R"(usage: quarterctl [--root DIR | --socket PATH] [--json] [--timeout SECONDS] COMMAND [OPTIONS]
       quarterctl COMMAND --help

Sends one request to quarterd and prints its reply.

Options:
  --root DIR         talk to the daemon of device root DIR; without --root and --socket, the
                     device root in QUARTERD_ROOT, else the host's own daemon
  --socket PATH      talk to the request socket at PATH
  --json             print the reply as JSON: one object, a list as an array of objects, and
                     an error as {"error": {"code", "name", "message"}}
  --timeout SECONDS  how long to wait for the reply (default 60, at most 86400)
  -h, --help         this text; COMMAND --help for a command's own options
  -V, --version      the version

Commands:
)";

const char kUsageTail[] = R"(
Classes (--class takes the name or the number):
%CLASSES%

--user defaults to the owner the class demands: 33 for the bundle classes, 499 for system
and system-group, otherwise 1 (the current mobile user).

Output: tables with a header line; a value alone where a command prints one thing; "ok" when
the reply holds nothing more. Control characters are shown escaped (\n, \x1b). A failure is
reported on standard error with its code and what it means:
quarterctl: error 21 (no such container).

Exit status: 0 success; 1 the daemon answered with an error; 2 usage errors, connection
failures and no reply.
)";

constexpr uint64_t kMaxTimeout = 86400;

bool isRequired(const Subcommand& row, const char* flag) {
  for (std::string_view names : row.required)
    if (names == flag) return true;
  return false;
}

std::string firstLine(const char* text) {
  std::string_view t = text;
  return std::string(t.substr(0, t.find('\n')));
}

// The class list in lines of at most 92 columns.
std::string wrappedClasses() {
  std::string out, line, list = classList();
  for (size_t at = 0; at < list.size();) {
    size_t end = std::min(list.find(", ", at), list.size());
    std::string item = list.substr(at, end - at) + (end < list.size() ? "," : "");
    if (!line.empty() && line.size() + item.size() > 90) {
      out += line + '\n';
      line.clear();
    }
    line += (line.empty() ? "  " : " ") + item;
    at = end + 2;
  }
  return out + line + '\n';
}

std::string usageText() {
  std::string out = kUsageHead;
  for (const Group* group : groups())
    for (const Subcommand& row : group->subcommands) {
      std::string name = row.name;
      out += "  " + name + std::string(name.size() < 29 ? 29 - name.size() : 1, ' ') + firstLine(row.help) + '\n';
    }
  std::string tail = kUsageTail;
  tail.replace(tail.find("%CLASSES%\n"), 10, wrappedClasses());
  return out + tail;
}

std::string subcommandUsage(const Subcommand& row) {
  std::string line = "usage: quarterctl [OPTIONS] " + std::string(row.name);
  std::string out;
  for (const Flag& flag : row.flags) {
    std::string option = flag.name;
    if (flag.value) option += std::string(" ") + flag.value;
    option = isRequired(row, flag.name) ? " " + option : " [" + option + "]";
    if (line.size() + option.size() > 92) {
      out += line + '\n';
      line = std::string(29 + std::string_view(row.name).size(), ' ');
    }
    line += option;
  }
  if (row.words) line += std::string(" ") + row.words;
  out += line + "\n\n" + row.help + "\n(command " + row.commands + ")\n";
  if (!row.flags.empty()) out += "\nOptions:\n";
  for (const Flag& flag : row.flags) {
    std::string left = std::string("  ") + flag.name + (flag.value ? std::string(" ") + flag.value : "");
    out += left + std::string(left.size() < 30 ? 30 - left.size() : 1, ' ') + flag.help + '\n';
  }
  for (std::string_view names : row.required)
    if (names.find('|') != std::string_view::npos) out += "One of " + std::string(names) + " is needed.\n";
  return out;
}

bool named(const Subcommand& row, const std::vector<std::string>& args, size_t* words) {
  std::string_view name = row.name;
  size_t space = name.find(' ');
  *words = space == std::string_view::npos ? 1 : 2;
  return space == std::string_view::npos
             ? args[0] == name
             : args.size() > 1 && args[0] == name.substr(0, space) && args[1] == name.substr(space + 1);
}

// The subcommand named by the first one or two words; *words says how many.
const Subcommand* findSubcommand(const std::vector<std::string>& args, size_t* words) {
  for (const Group* group : groups())
    for (const Subcommand& row : group->subcommands)
      if (named(row, args, words)) return &row;
  return nullptr;
}

// The help of every subcommand whose name starts with the word ("info").
bool printFamilyHelp(const std::string& word) {
  bool found = false;
  for (const Group* group : groups())
    for (const Subcommand& row : group->subcommands)
      if (std::string_view(row.name).starts_with(word + " ")) {
        std::cout << (found ? "\n" : "") << subcommandUsage(row);
        found = true;
      }
  return found;
}

Args parseArgs(const Subcommand& row, std::vector<std::string> args, size_t first) {
  Args a;
  std::vector<LongOption> longs;
  constexpr int kBase = 1000;
  bool human = false;
  for (size_t i = 0; i < row.flags.size(); ++i) {
    longs.push_back({row.flags[i].name + 2, row.flags[i].value != nullptr, kBase + static_cast<int>(i)});
    human = human || std::string_view(row.flags[i].name) == "--human-readable";
  }
  if (human)
    std::replace(args.begin() + static_cast<std::ptrdiff_t>(first), args.end(), std::string("-h"),
                 std::string("--human-readable"));
  parseLong(args, first, longs, row.name, row.words != nullptr, [&](int c, const char* value) {
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
  if (const char* root = getenv("QUARTERD_ROOT"); root && *root) options.deviceRoot = root;
  bool rootGiven = false;
  enum { kRoot = 1000, kSocket, kJson, kTimeout };
  static const option kLong[] = {
      {"root", required_argument, nullptr, kRoot},
      {"socket", required_argument, nullptr, kSocket},
      {"json", no_argument, nullptr, kJson},
      {"timeout", required_argument, nullptr, kTimeout},
      {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  opterr = 0;
  for (int c; (c = getopt_long(argc, argv, "+:hV", kLong, nullptr)) != -1;) {
    switch (c) {
      case kRoot:
        options.deviceRoot = optarg;
        rootGiven = true;
        break;
      case kSocket:
        options.socketPath = optarg;
        options.socketGiven = true;
        break;
      case kJson: options.json = true; break;
      case kTimeout: {
        uint64_t seconds = parseUnsigned(optarg, "--timeout");
        if (seconds > kMaxTimeout) throw UsageError{"--timeout is larger than the limit of 86400 seconds (a day)"};
        options.timeout = std::chrono::seconds(seconds);
        break;
      }
      case 'h': *help = true; break;
      case 'V': *version = true; break;
      case ':': throw UsageError{std::string(argv[optind - 1]) + " needs a value"};
      default: throw UsageError{"unknown option " + std::string(argv[optind - 1])};
    }
  }
  if (rootGiven && options.socketGiven) throw UsageError{"--root and --socket both name the daemon; give one"};
  if (rootGiven && options.deviceRoot.empty()) throw UsageError{"--root needs a directory"};
  // QuarterKit knows where the sockets are: under a device root, or the host's.
  if (!options.socketGiven)
    options.socketPath =
        options.deviceRoot.empty() ? qk::requestSocketPath() : qk::requestSocketPath(options.deviceRoot);
  options.args.assign(argv + optind, argv + argc);
  return options;
}

bool wantsHelp(const std::vector<std::string>& args, size_t first, const Subcommand& row) {
  bool human = std::any_of(row.flags.begin(), row.flags.end(),
                           [](const Flag& f) { return std::string_view(f.name) == "--human-readable"; });
  return std::any_of(args.begin() + static_cast<std::ptrdiff_t>(first), args.end(),
                     [&](const std::string& a) { return a == "--help" || (a == "-h" && !human); });
}

int run(int argc, char** argv) {
  bool help = false, version = false;
  Global options = parseOptions(argc, argv, &help, &version);
  if (version) {
    std::cout << "quarterctl " << QRT_VERSION << '\n';
    return kExitOK;
  }
  std::vector<std::string>& args = options.args;
  if (!args.empty() && args[0] == "help") {
    args.erase(args.begin());
    help = true;
  }
  if (args.empty()) {
    if (!help) throw UsageError{"no command given"};
    std::cout << usageText();
    return kExitOK;
  }
  size_t words = 0;
  const Subcommand* row = findSubcommand(args, &words);
  if (!row) {
    const bool asked = help || std::find(args.begin(), args.end(), "--help") != args.end() ||
                       std::find(args.begin(), args.end(), "-h") != args.end();
    if (asked && printFamilyHelp(args[0])) return kExitOK;
    if (asked && args[0].starts_with("-")) {
      std::cout << usageText();
      return kExitOK;
    }
    std::string second;
    for (const Group* group : groups())
      for (const Subcommand& row : group->subcommands)
        if (std::string_view(row.name).starts_with(args[0] + " "))
          second += (second.empty() ? "" : ", ") + std::string(row.name).substr(args[0].size() + 1);
    if (!second.empty()) throw UsageError{args[0] + " needs one of: " + second};
    throw UsageError{"unknown command " + args[0]};
  }
  if (help || wantsHelp(args, words, *row)) {
    std::cout << subcommandUsage(*row);
    return kExitOK;
  }
  return row->run(options, parseArgs(*row, args, words));
}
}  // namespace

}  // namespace ctl

int main(int argc, char** argv) {
  try {
    return ctl::run(argc, argv);
  } catch (const ctl::UsageError& e) {
    // Messages quote what was given, which may come from anywhere.
    std::cerr << "quarterctl: " << ctl::printable(e.message) << "\n(quarterctl --help for usage)\n";
  } catch (const std::exception& e) { std::cerr << "quarterctl: " << ctl::printable(e.what()) << '\n'; }
  return ctl::kExitUsage;
}
