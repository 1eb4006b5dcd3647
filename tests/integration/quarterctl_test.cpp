// The quarterctl binary against the real daemon: what it prints for people
// and for scripts, and the exit status that scripts rely on; the tools'
// --help against their man pages.
#include <stdlib.h>
#include <sys/wait.h>

#include <filesystem>
#include <functional>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

// The rows of a table, cut at the columns of its header line.
std::vector<std::map<std::string, std::string>> rows(const std::string& out) {
  std::istringstream in(out);
  std::string header, line;
  std::getline(in, header);
  std::vector<std::pair<std::string, size_t>> columns;
  for (size_t at = 0; (at = header.find_first_not_of(' ', at)) != std::string::npos;) {
    size_t end = header.find(' ', at);
    columns.emplace_back(header.substr(at, end - at), at);
    at = end;
  }
  std::vector<std::map<std::string, std::string>> table;
  while (std::getline(in, line) && !line.empty()) {
    table.emplace_back();
    for (size_t c = 0; c < columns.size(); ++c) {
      std::string cell =
          line.substr(std::min(line.size(), columns[c].second),
                      c + 1 < columns.size() ? columns[c + 1].second - columns[c].second : std::string::npos);
      table.back()[columns[c].first] = cell.substr(0, cell.find_last_not_of(' ') + 1);
    }
  }
  return table;
}

class QuarterctlTest : public DaemonFixture {
 protected:
  // The daemon knows callers by executable path, so a copy of its own
  // gets the master entitlement and the original none.
  void SetUp() override {
    DaemonFixture::SetUp();
    if (!HasFatalFailure()) ctl = entitledQuarterctl();
  }

  // Runs the binary with --root and the arguments, as a shell splits them.
  ProgramRun run(const std::string& args) { return shell(ctl + " --root " + root + " " + args); }
  // The daemon's refusal: exit 1, nothing on standard output, the code named on standard error
  // (what follows "quarterctl: "; the whole text when it is not so).
  std::string refusal(const std::string& args, bool withRoot = true) {
    ProgramRun r = withRoot ? run(args) : shell(args);
    const bool plain = r.status == 1 && r.out.empty() && r.err.starts_with("quarterctl: ") && r.err.ends_with("\n");
    return plain ? r.err.substr(12, r.err.size() - 13) : "status " + std::to_string(r.status) + ": " + r.out + r.err;
  }
  ProgramRun shell(const std::string& command) {
    const std::string out = root + "/ctl.out", err = root + "/ctl.err";
    int status = system((command + " >" + out + " 2>" + err).c_str());
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, readFile(out), readFile(err)};
  }

  std::string ctl;
};

TEST_F(QuarterctlTest, TablesJsonAndTheContainerFoundWithoutItsUUID) {
  auto created = rows(run("create --class app-data --identifier com.example.ctl").out);
  ASSERT_EQ(created.size(), 1u);
  EXPECT_EQ(created[0]["IDENTIFIER"], "com.example.ctl");
  EXPECT_EQ(created[0]["EXISTED"], "no");
  const std::string path = created[0]["PATH"], uuid = created[0]["UUID"];
  EXPECT_EQ(path.rfind(root + "/private/var/mobile/Containers/Data/Application/", 0), 0u);
  EXPECT_TRUE(std::filesystem::is_directory(path));
  EXPECT_EQ(rows(run("lookup --class 2 --identifier com.example.ctl").out)[0]["EXISTED"], "yes");
  auto listed = rows(run("list --class app-data").out);
  ASSERT_EQ(listed.size(), 1u);
  EXPECT_EQ(listed[0],
            (std::map<std::string, std::string>{{"IDENTIFIER", "com.example.ctl"}, {"UUID", uuid}, {"PATH", path}}));

  // Info values, with and without --uuid; a hostile key and value stay on their line.
  const std::string one = " --class app-data --identifier com.example.ctl";
  for (const auto& [value, shown] : std::vector<std::pair<std::string, std::string>>{
           {"'str:deep blue'", "deep blue"},
           {"u64:18446744073709551615", "18446744073709551615"},
           {"\"$(printf 'str:two\\nlines\\033[2J')\"", "two\\nlines\\x1b[2J"}}) {
    for (const std::string& which : {one, one + " --uuid " + uuid}) {
      EXPECT_EQ(run("info set" + which + " --key \"$(printf 'Col\\nour')\" --value " + value).status, 0) << value;
      EXPECT_EQ(run("info get" + which + " --key \"$(printf 'Col\\nour')\"").out, shown + "\n");
    }
  }
  EXPECT_TRUE(run("metadata --info" + one).out.ends_with("\nCol\\nour  two\\nlines\\x1b[2J\n"));
  EXPECT_EQ(run("info set" + one + " --key \"$(printf 'Col\\nour')\"").out, "ok\n") << "no --value removes the key";
  EXPECT_EQ(refusal("info get" + one + " --key \"$(printf 'Col\\nour')\""), "error 24 (no such info value)");
  const std::string bytes = rows(run("du" + one).out)[0]["SIZE"], size = rows(run("du -h" + one).out)[0]["SIZE"];
  EXPECT_TRUE(size.ends_with(" KiB") || size == bytes + " B") << bytes << " shown as " << size;

  // --json: objects, a list an array of them, no ReplyError; an error object on failure.
  struct {
    std::string args, json;
  } scripts[] = {
      {"lookup" + one,
       "{\"existed\":true,\"identifier\":\"com.example.ctl\",\"path\":\"" + path + "\",\"uuid\":\"" + uuid + "\"}"},
      {"list --class 2", "[{\"identifier\":\"com.example.ctl\",\"path\":\"" + path + "\",\"uuid\":\"" + uuid + "\"}]"},
      {"du" + one, "{\"bytes\":" + bytes + ",\"identifier\":\"com.example.ctl\",\"uuid\":\"" + uuid + "\"}"},
      {"metadata" + one,
       "{\"identifier\":\"com.example.ctl\",\"path\":\"" + path + "\",\"transient\":false,\"uuid\":\"" + uuid + "\"}"},
      {"delete" + one, "{}"},
      {"delete" + one, "{\"error\":{\"code\":21,\"message\":\"no such container\",\"name\":\"QRTErrorNotFound\"}}"},
  };
  for (const auto& [args, json] : scripts) EXPECT_EQ(run("--json " + args).out, json + "\n") << args;
  EXPECT_EQ(run("deathrow").out, "ok\n");
  EXPECT_EQ(run("list --class app-data").out, "IDENTIFIER  UUID  PATH\n");
}

TEST_F(QuarterctlTest, ExitStatusTellsDaemonErrorsFromUsageErrors) {
  // The daemon's refusal: exit 1 with the code named on standard error,
  // whichever way the options and the device root are given.
  struct {
    std::string command, err;
  } refusals[] = {
      {ctl + " --root " + root + " delete --class 2 --identifier com.example.none", "error 21 (no such container)"},
      {ctl + " --root=" + root + " lookup --class=app-data --identifier=com.example.none",
       "error 21 (no such container)"},
      {"QUARTERD_ROOT=" + root + " " + ctl +
           " info get --class 2 --identifier com.example.none --uuid "
           "00000000-0000-0000-0000-000000000000 --key k",
       "error 21 (no such container)"},
      // The original binary has no identity, so no entitlement.
      {std::string(QRT_QUARTERCTL_PATH) + " --root " + root + " deathrow", "error 55 (not entitled)"},
  };
  for (const auto& [command, err] : refusals) EXPECT_EQ(refusal(command, false), err) << command;

  // Usage and connection trouble: exit 2, and nothing reaches the daemon.
  writeFile(root + "/big", "<plist><data>" + std::string(1400000, 'A') + "</data></plist>");
  struct {
    std::string args, err;
  } usage[] = {
      {"list", "list needs --class"},
      {"info get --class 2 --identifier a", "info get needs --key"},
      {"create --class 2 --bogus", "unknown argument to create: --bogus"},
      {"create --class", "--class needs a value"},
      {"raw --file", "--file needs a value"},
      {"stage --entry 501:2:not-a-uuid:a", "not a UUID for --entry"},
      {"list --class 14", "unknown class for --class: 14; one of app-bundle (1),"},
      {"create --class app-bundle --user 501", "class app-bundle belongs to user 33"},
      {"create --class 2 --user 4294967295", "--user 4294967295 is out of range: user ids are 0 to 4294967294"},
      {"protect --identifier a --protection-class 5", "protection classes are 0 to 4"},
      {"create --class 2 --identifier " + std::string(256, 'a'), "256 bytes, longer than the 255-byte limit"},
      {"create --class 2 --identifier \"$(printf 'a\\nb')\"", "--identifier holds a control character: a\\nb"},
      {"info set --class 2 --identifier a --key k --value plist:" + root + "/big", "value larger than the 1 MiB limit"},
      {"--socket /x deathrow", "--root and --socket both name the daemon"},
      {"--root " + root + "/nowhere deathrow",
       "is quarterd running on this device root? start it with: quarterd --root"},
  };
  for (const auto& [args, err] : usage) {
    ProgramRun r = run(args);
    EXPECT_EQ(r.status, 2) << args;
    EXPECT_TRUE(contains(r.err, err)) << args << ": " << r.err;
  }
  ProgramRun down = shell(ctl + " --socket " + root + "/nowhere deathrow");
  EXPECT_TRUE(contains(down.err, "\nquarterctl: is quarterd running? try: systemctl status quarterd\n")) << down.err;
}

TEST_F(QuarterctlTest, StageWipeSystemPathAndAssets) {
  const std::string staged = rows(run("create --class 2 --identifier com.example.staged").out)[0]["UUID"];
  EXPECT_EQ(run("stage --entry 501:app-data:" + staged + ":com.example.staged").status, 0);
  EXPECT_FALSE(contains(run("list --class 2").out, "com.example.staged"));

  const std::string path = rows(run("create --class 2 --identifier com.example.keep").out)[0]["PATH"];
  writeFile(path + "/Documents/file", "data");
  EXPECT_EQ(run("wipe --class 2 --identifier com.example.keep").status, 0);
  EXPECT_FALSE(exists(path + "/Documents/file"));
  EXPECT_EQ(run("wipe --addon --identifier com.example.keep").status, 1);

  ProgramRun sys = run("system-path --identifier com.example.daemon");
  EXPECT_EQ(sys.status, 0) << sys.err;
  EXPECT_TRUE(std::filesystem::is_directory(sys.out.substr(0, sys.out.size() - 1))) << sys.out;

  ASSERT_EQ(run("create --class 2 --identifier com.example.assets").status, 0);
  ProgramRun assets = run("assets-path --identifier com.example.assets --relative");
  EXPECT_TRUE(assets.out.starts_with("Library/com.norvane.UserManagedAssets.")) << assets.err;
  EXPECT_EQ(run("assets-delete --identifier com.example.assets --source ../x").status, 1);
}

TEST_F(QuarterctlTest, CodeSigningAndGroups) {
  writePlist(root + "/ents.plist", {{"com.norvane.security.application-groups", plist::Array{"group.one", "group.two"}},
                                    {"com.norvane.security.system-groups", "systemgroup.com.example.shared"}});
  const std::string set = "codesign set --identifier com.example.app";
  EXPECT_EQ(run(set + " --entitlements " + root + "/ents.plist --data-class app-data").status, 0);
  EXPECT_TRUE(contains(run("codesign get --identifier com.example.app").out, "group.two"));
  EXPECT_EQ(run("groups ids --identifier com.example.app").out, "GROUP\ngroup.one\ngroup.two\n");
  auto paths = rows(run("groups paths --identifier com.example.app").out);
  ASSERT_EQ(paths.size(), 2u);
  EXPECT_EQ(paths[1]["GROUP"], "group.two");
  EXPECT_TRUE(std::filesystem::is_directory(paths[1]["PATH"]));
  // quarterctl itself is not entitled to the system group.
  EXPECT_EQ(run("system-group-path --group systemgroup.com.example.shared").status, 1);
  EXPECT_EQ(rows(run("groups paths --system --identifier com.example.app").out)[0]["GROUP"],
            "systemgroup.com.example.shared");

  EXPECT_EQ(run(set + " --remove").status, 0);
  EXPECT_EQ(refusal("codesign get --identifier com.example.app"), "error 21 (no such container)");
  EXPECT_EQ(run("codesign invalidate-missing").status, 0);
  EXPECT_EQ(run(set).status, 2) << "one of the three is required";
}

TEST_F(QuarterctlTest, StatusMetricsAndTheLogLevelOfTheRunningDaemon) {
  // Served requests are logged at 7 only; the level changes without a restart.
  EXPECT_EQ(run("log-level 5").out, "log level 5 (was 7)\n");
  ASSERT_EQ(run("create --class app-data --identifier com.example.quiet").status, 0);
  EXPECT_EQ(run("log-level 7").out, "log level 7 (was 5)\n");
  ASSERT_EQ(run("create --class app-data --identifier com.example.loud").status, 0);
  const std::string served = "Served createOrLookupContainer for uid 0 pid ";
  ASSERT_TRUE(logContains(served));
  const std::string log = logText();
  EXPECT_EQ(log.find(served), log.rfind(served)) << "one line, for the request made at 7";
  EXPECT_TRUE(contains(log.substr(log.find(served)), "(com.norvane.quarterctl): 1 in ")) << log;
  EXPECT_EQ(run("log-level 8").status, 2);
  EXPECT_EQ(run("raw Command=u64:103 LogLevel=u64:9").status, 1);
  EXPECT_EQ(run("raw Command=u64:99").status, 1);

  auto status = call(QRTCommandStatus);
  ASSERT_TRUE(status) << "not entitled: the test program has no identity";
  EXPECT_EQ(plist::find(*status, QRTReplyKeyError)->integer().bits, 55u);
  ASSERT_EQ(run("deathrow").status, 0) << "start-up's pass, at idle priority, is over first";
  const std::string json = run("--json status").out;
  for (const std::string part :
       {"\"containers\":{\"addon-bundle\":0,", "\"app-data\":2,", "\"deathrow\":{\"bytes\":0,\"items\":0}",
        "\"identities\":{\"entries\":1,\"refused_files\":0}", "\"failed\":1,\"name\":\"other\"",
        "\"name\":\"createOrLookupContainer\",\"p50_us\":", "\"upcalls\":{\"failed\":0,"})
    EXPECT_TRUE(contains(json, part)) << part << " in " << json;
  EXPECT_TRUE(contains(run("status").out, "\ndeath row                   0 items, 0 B\n"));

  const std::string metrics = run("metrics").out;
  for (const std::string part :
       {"# TYPE quarterd_request_duration_seconds histogram\n", "quarterd_containers{class=\"app-data\"} 2\n",
        "quarterd_request_duration_seconds_count{command=\"createOrLookupContainer\"} 2\n",
        "quarterd_request_duration_seconds_bucket{command=\"setLogLevel\",le=\"+Inf\"} ",
        "quarterd_requests_failed_total{command=\"other\"} 1\n", "quarterd_upcall_duration_seconds_count 0\n"})
    EXPECT_TRUE(contains(metrics, part)) << part << " in " << metrics;
  EXPECT_TRUE(metrics.ends_with("\n# EOF\n"));
}

// Every kind of finding planted on one device root: verify reports each,
// --repair fixes what it may and leaves the rest, which a new run reports again.
TEST_F(QuarterctlTest, VerifyReportsAndRepairsEveryPlantedFinding) {
  namespace fs = std::filesystem;
  const Container sys = createOrLookup(0, "com.norvane.mapsd", 12, true, false, QRTCommandSystemContainerPath),
                  moved = make(501, "com.example.moved", 2), owned = make(501, "com.example.owned", 2),
                  addon = make(501, "com.example.addon", 4), twin = make(501, "com.example.twin", 2);
  auto verify = [&](const std::string& args) {
    ProgramRun r = run("--json verify " + args);
    EXPECT_EQ(r.status, 0) << r.err;
    return nlohmann::json::parse(r.out.empty() ? "{}" : r.out);
  };
  // Passes run one after the other: once this one answers, start-up's has ended.
  ASSERT_EQ(run("deathrow").status, 0);
  ASSERT_EQ(verify("")["findings"], nlohmann::json::array()) << "a sound store";
  const std::string app = appClassDir() + "/", caches = daemonCaches() + "/",
                    library = root + "/private/var/root/Library/QuarterKit/",
                    maps = root + "/run/sandbox/mappings/0/4/";
  const uint32_t owner = ownerAndMode(owned.path).first;
  const std::string named = "getfacl -cp " + sys.path + " | grep -E '^(default:)?(user|group):[^:]'",
                    acl = output(named);
  auto gone = [](std::string path) { return [path] { return !fs::exists(fs::symlink_status(path)); }; };
  auto kept = [](std::string path) { return [path] { return fs::exists(fs::symlink_status(path)); }; };
  auto relink = [](std::string link, std::string to) {
    return [=] {
      fs::remove(link);
      fs::create_symlink(to, link);
    };
  };
  auto oldFile = [](std::string path) {
    return [path] { writeFile(path, "x"), output("touch -d 2000-01-01 " + path); };
  };
  struct {
    const char* kind;
    std::string subject;
    std::function<void()> plant;  // none: planted by the row above
    std::function<bool()> after;  // the state --repair leaves
    bool repaired;
  } plants[] = {
      {"metadata-unreadable", app + "junk",
       [&] { fs::create_directories(app + "junk"), writeFile(app + "junk/" + kMetadataFile, "not a plist"); },
       gone(app + "junk"), true},
      {"metadata-wrong-class", app + "addon", [&] { fs::rename(addon.path, app + "addon"); }, gone(app + "addon"),
       true},
      {"cache-entry-stale",
       addon.path,
       {},
       [&] { return createOrLookup(501, addon.identifier, 4, false).error == 21; },
       true},
      {"cache-entry-stale", moved.path, [&] { fs::rename(moved.path, app + "renamed"); },
       [&] { return createOrLookup(501, moved.identifier, 2, false).path == app + "renamed"; }, true},
      {"cache-entry-missing", app + "renamed", {}, kept(app + "renamed"), true},
      {"owner-drift", owned.path, [&] { output("chown 4242 " + owned.path); },
       [&] { return ownerAndMode(owned.path).first == owner; }, true},
      {"identifier-duplicate", app + "twin", [&] { fs::copy(twin.path, app + "twin", fs::copy_options::recursive); },
       kept(app + "twin"), false},
      {"owner-drift", app + "twin", {}, [&] { return ownerAndMode(app + "twin").first == owner; }, true},
      {"acl-drift", sys.path, [&] { output("setfacl -b " + sys.path); }, [&] { return output(named) == acl; }, true},
      {"sandbox-mapping-wrong", std::string("com.norvane.mapsd"),
       relink(maps + std::string("com.norvane.mapsd"), "/nowhere"),
       [&] { return readLink(maps + std::string("com.norvane.mapsd")) == sys.path; }, true},
      {"sandbox-mapping-orphan", "com.example.gone", relink(maps + "com.example.gone", "/nowhere"),
       gone(maps + "com.example.gone"), true},
      {"staging-leftover", caches + "Staging/left", [&] { fs::create_directories(caches + "Staging/left"); },
       gone(caches + "Staging/left"), true},
      {"transient-leftover", caches + "Temp/stray", [&] { fs::create_directories(caches + "Temp/stray"); },
       gone(caches + "Temp/stray"), true},
      {"deathrow-backlog", caches + "Dead", [&] { fs::create_directories(caches + "Dead/old"); },
       gone(caches + "Dead/old"), true},
      {"replace-journal-stale", library + "Replace/j", oldFile(library + "Replace/j"), kept(library + "Replace/j"),
       false},
      {"protection-update-stale", library + "PendingUpdates/u", oldFile(library + "PendingUpdates/u"),
       kept(library + "PendingUpdates/u"), false},
      {"codesign-orphan", "com.example.nobundle",
       [&] {
         writePlist(root + "/ents.plist", {{"com.norvane.security.application-groups", "g.one"}});
         run("codesign set --identifier com.example.nobundle --entitlements " + root + "/ents.plist");
       },
       [] { return true; }, true},
  };
  for (const auto& p : plants)
    if (p.plant) p.plant();
  auto findingsOf = [](const nlohmann::json& reply) {
    std::multimap<std::pair<std::string, std::string>, nlohmann::json> found;
    for (const auto& f : reply["findings"]) found.emplace(std::pair{f["kind"], f["subject"]}, f);
    return found;
  };
  const nlohmann::json first = verify("");
  const auto reported = findingsOf(first);
  const auto repaired = findingsOf(verify("--repair"));
  EXPECT_EQ(run("deathrow").status, 0) << "what the repair moved to death row goes";
  const auto left = findingsOf(verify(""));
  for (const auto& p : plants) {
    const std::pair<std::string, std::string> key{p.kind, p.subject};
    ASSERT_EQ(reported.count(key), 1u) << p.kind << " " << p.subject;
    const nlohmann::json& f = reported.find(key)->second;
    EXPECT_EQ(f.size(), 6u) << f;
    EXPECT_FALSE(f["detail"].get<std::string>().empty() || f["action"].get<std::string>().empty()) << f;
    EXPECT_TRUE(f["severity"] == "error" || f["severity"] == "warning" || f["severity"] == "notice") << f;
    ASSERT_EQ(repaired.count(key), 1u) << p.kind;
    EXPECT_EQ(repaired.find(key)->second["repaired"], p.repaired) << p.kind << " " << p.subject;
    EXPECT_TRUE(p.after()) << p.kind << " " << p.subject;
    EXPECT_EQ(left.count(key), p.repaired ? 0u : 1u) << p.kind << " " << p.subject;
  }
  EXPECT_EQ(reported.size(), std::size(plants)) << first.dump(1);
  EXPECT_TRUE(contains(run("verify").out, "containers checked, 3 findings\n"));
}

// Each command with its --options, as one source names them; "" holds the global options.
using Commands = std::map<std::string, std::set<std::string>>;

// The --options in a text; roff writes a dash as \-.
std::set<std::string> optionsIn(std::string text) {
  for (size_t at; (at = text.find("\\-")) != std::string::npos;) text.erase(at, 1);
  std::set<std::string> found;
  for (size_t at = 0; (at = text.find("--", at)) != std::string::npos; at += 2) {
    size_t end = text.find_first_not_of("abcdefghijklmnopqrstuvwxyz-", at + 2);
    found.insert(text.substr(at, end - at));
  }
  return found;
}

TEST(QuarterctlDocs, HelpManPageAndCompletionNameTheSameCommandsAndOptions) {
  const std::string binary = QRT_QUARTERCTL_PATH;
  Commands help, page, completion;
  std::istringstream usage(output(binary + " --help"));
  bool inCommands = false;
  for (std::string line; std::getline(usage, line);) {
    if (line.starts_with("  -")) help[""].merge(optionsIn(line.substr(0, 20)));
    if (line == "Commands:" || line.empty()) inCommands = line == "Commands:";
    if (!inCommands || line == "Commands:") continue;
    const std::string name = line.substr(2, line.find("  ", 2) - 2);
    std::istringstream own(output(binary + " " + name + " --help"));
    help[name];
    for (std::string option; std::getline(own, option);)
      if (option.starts_with("  --")) help[name].merge(optionsIn(option.substr(0, option.find(' ', 2))));
  }

  // A heading of the man page: ".B name words \-\-option ..." after a .TP.
  std::istringstream roff(readFile(std::string(QRT_MAN_DIR) + "/quarterctl.1"));
  std::string section, previous;
  for (std::string line; std::getline(roff, line); previous = line) {
    if (line.starts_with(".SH ")) section = line.substr(4);
    if (previous != ".TP" || (section != "COMMANDS" && section != "OPTIONS")) continue;
    for (size_t at; (at = line.find("\\-")) != std::string::npos;) line.erase(at, 1);
    std::string name;
    for (std::istringstream words(line.substr(line.find(' ') + 1)); section == "COMMANDS";) {
      std::string word;
      if (!(words >> word) || word[0] == '-' || word.find_first_of("\\[(") != std::string::npos) break;
      name += (name.empty() ? "" : " ") + word;
    }
    page[name].merge(optionsIn(line));
  }

  std::istringstream bash(readFile(std::string(QRT_MAN_DIR) + "/../bash-completion/quarterctl"));
  for (std::string line; std::getline(bash, line);) {
    size_t paren = line.find(") opts=\"");
    if (line.find("globals=\"") != std::string::npos) completion[""] = optionsIn(line);
    if (paren == std::string::npos) continue;
    std::string name = line.substr(line.find_first_not_of(' '), paren - line.find_first_not_of(' '));
    if (name.front() == '"') name = name.substr(1, name.size() - 2);
    completion[name] = optionsIn(line.substr(paren));
  }
  EXPECT_GE(help.size(), 30u);
  EXPECT_EQ(help, page);
  EXPECT_EQ(help, completion);
}

TEST(ManPages, AgreeWithHelpOnEveryOption) {
  for (const auto& [binary, page] : {std::pair{QRT_DAEMON_PATH, "quarterd.8"}, {QRT_EXEC_PATH, "quarter-exec.1"}}) {
    const std::set<std::string> help = optionsIn(output(std::string(binary) + " --help"));
    EXPECT_GE(help.size(), 5u) << binary;
    EXPECT_EQ(help, optionsIn(readFile(std::string(QRT_MAN_DIR) + "/" + page))) << page;
  }
}

}  // namespace
