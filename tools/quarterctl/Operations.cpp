// Subcommands for running the daemon: its status, its metrics in the
// OpenMetrics text format, and the log level of the running daemon.
#include <cinttypes>
#include <cstdio>
#include <iostream>

#include "Cli.h"

namespace ctl {

namespace {

using G = const Global&;
using A = const Args&;

uint64_t u64Of(const plist::Dictionary& d, const char* key) {
  const plist::Value* v = plist::find(d, key);
  const plist::Integer* i = v ? v->integerIf() : nullptr;
  return i ? i->asUnsigned() : 0;
}

const plist::Dictionary& statusOf(const qk::Reply& reply) {
  static const plist::Dictionary kEmpty;
  const plist::Dictionary* status = reply.dictionary(QRTReplyKeyStatus);
  return status ? *status : kEmpty;
}

const plist::Array& arrayOf(const plist::Dictionary& d, const char* key) {
  static const plist::Array kEmpty;
  const plist::Value* v = plist::find(d, key);
  return v && v->arrayIf() ? *v->arrayIf() : kEmpty;
}

const plist::Dictionary& dictionaryOf(const plist::Value& v) {
  static const plist::Dictionary kEmpty;
  return v.dictionaryIf() ? *v.dictionaryIf() : kEmpty;
}

std::string nameOf(const plist::Dictionary& d) {
  const plist::Value* v = plist::find(d, QRTStatusKeyName);
  return v && v->stringIf() ? *v->stringIf() : "other";
}

std::string durationText(uint64_t seconds) {
  char buf[64];
  if (seconds < 60) return std::to_string(seconds) + " s";
  if (seconds < 3600)
    snprintf(buf, sizeof buf, "%" PRIu64 " min %" PRIu64 " s", seconds / 60, seconds % 60);
  else if (seconds < 86400)
    snprintf(buf, sizeof buf, "%" PRIu64 " h %" PRIu64 " min", seconds / 3600, seconds % 3600 / 60);
  else
    snprintf(buf, sizeof buf, "%" PRIu64 " d %" PRIu64 " h", seconds / 86400, seconds % 86400 / 3600);
  return buf;
}

std::string microsText(uint64_t micros) {
  char buf[32];
  if (micros < 1000) return std::to_string(micros) + " us";
  snprintf(buf, sizeof buf,
           micros < 10000     ? "%.2f ms"
           : micros < 1000000 ? "%.1f ms"
                              : "%.2f s",
           micros < 1000000 ? static_cast<double>(micros) / 1000 : static_cast<double>(micros) / 1e6);
  return buf;
}

std::string plural(uint64_t n, const char* one, const char* many) {
  return std::to_string(n) + " " + (n == 1 ? one : many);
}

nlohmann::json latencyJson(const plist::Dictionary& d) {
  return {{"served", u64Of(d, QRTStatusKeyServed)},
          {"failed", u64Of(d, QRTStatusKeyFailed)},
          {"p50_us", u64Of(d, QRTStatusKeyP50)},
          {"p99_us", u64Of(d, QRTStatusKeyP99)}};
}

void showStatus(const qk::Reply& reply) {
  const plist::Dictionary& s = statusOf(reply);
  std::string perClass;
  const plist::Array& classes = arrayOf(s, QRTStatusKeyContainersPerClass);
  for (size_t c = 1; c < classes.size(); ++c) {
    const plist::Integer* n = classes[c].integerIf();
    if (n && n->asUnsigned() > 0)
      perClass += (perClass.empty() ? "" : ", ") + className(c) + " " + std::to_string(n->asUnsigned());
  }
  Table figures({"FIGURE", "VALUE"});
  figures.add({"uptime", durationText(u64Of(s, QRTStatusKeyUptime))});
  figures.add({"containers cached", std::to_string(u64Of(s, QRTStatusKeyCachedContainers)) +
                                        (perClass.empty() ? "" : " (" + perClass + ")")});
  figures.add({"cache memory", "about " + sizeText(u64Of(s, QRTStatusKeyCacheBytes), true)});
  figures.add({"death row", plural(u64Of(s, QRTStatusKeyDeathRowItems), "item", "items") + ", " +
                                sizeText(u64Of(s, QRTStatusKeyDeathRowBytes), true)});
  figures.add({"pending protection updates", std::to_string(u64Of(s, QRTStatusKeyPendingProtection))});
  figures.add({"identity registry", plural(u64Of(s, QRTStatusKeyIdentities), "entry", "entries") + ", " +
                                        plural(u64Of(s, QRTStatusKeyIdentitiesRefused), "file", "files") + " refused"});
  figures.add({"log level", std::to_string(u64Of(s, QRTStatusKeyLogLevel))});
  figures.print();
  std::cout << '\n';
  Table latency({"COMMAND", "NAME", "SERVED", "FAILED", "P50", "P99"});
  auto row = [&](const std::string& number, const std::string& name, const plist::Dictionary& d) {
    latency.add({number, name, std::to_string(u64Of(d, QRTStatusKeyServed)),
                 std::to_string(u64Of(d, QRTStatusKeyFailed)), microsText(u64Of(d, QRTStatusKeyP50)),
                 microsText(u64Of(d, QRTStatusKeyP99))});
  };
  for (const plist::Value& v : arrayOf(s, QRTStatusKeyRequests)) {
    const plist::Dictionary& d = dictionaryOf(v);
    const uint64_t command = u64Of(d, QRTStatusKeyCommand);
    row(command == UINT64_MAX ? "-" : std::to_string(command), nameOf(d), d);
  }
  const plist::Value* upcalls = plist::find(s, QRTStatusKeyUpcalls);
  row("-", "kernel upcalls", upcalls ? dictionaryOf(*upcalls) : plist::Dictionary{});
  latency.print();
}

nlohmann::json statusJson(const qk::Reply& reply) {
  const plist::Dictionary& s = statusOf(reply);
  nlohmann::json classes = nlohmann::json::object();
  const plist::Array& perClass = arrayOf(s, QRTStatusKeyContainersPerClass);
  for (size_t c = 1; c < perClass.size(); ++c)
    if (const plist::Integer* n = perClass[c].integerIf()) classes[className(c)] = n->asUnsigned();
  nlohmann::json requests = nlohmann::json::array();
  for (const plist::Value& v : arrayOf(s, QRTStatusKeyRequests)) {
    const plist::Dictionary& d = dictionaryOf(v);
    nlohmann::json entry = latencyJson(d);
    const uint64_t command = u64Of(d, QRTStatusKeyCommand);
    entry["command"] = command == UINT64_MAX ? nlohmann::json(nullptr) : nlohmann::json(command);
    entry["name"] = nameOf(d);
    requests.push_back(std::move(entry));
  }
  const plist::Value* upcalls = plist::find(s, QRTStatusKeyUpcalls);
  return {
      {"uptime_seconds", u64Of(s, QRTStatusKeyUptime)},
      {"containers", classes},
      {"cached_containers", u64Of(s, QRTStatusKeyCachedContainers)},
      {"cache_bytes", u64Of(s, QRTStatusKeyCacheBytes)},
      {"deathrow", {{"items", u64Of(s, QRTStatusKeyDeathRowItems)}, {"bytes", u64Of(s, QRTStatusKeyDeathRowBytes)}}},
      {"pending_protection_updates", u64Of(s, QRTStatusKeyPendingProtection)},
      {"identities",
       {{"entries", u64Of(s, QRTStatusKeyIdentities)}, {"refused_files", u64Of(s, QRTStatusKeyIdentitiesRefused)}}},
      {"log_level", u64Of(s, QRTStatusKeyLogLevel)},
      {"requests", requests},
      {"upcalls", latencyJson(upcalls ? dictionaryOf(*upcalls) : plist::Dictionary{})}};
}

// ---- OpenMetrics ----

// Label values are names the daemon and this tool chose; escaped all the same.
std::string labelValue(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '\\' || c == '"') out += '\\';
    if (c == '\n') {
      out += "\\n";
      continue;
    }
    out += c;
  }
  return out;
}

void family(const char* name, const char* type, const char* help) {
  std::cout << "# TYPE " << name << ' ' << type << "\n# HELP " << name << ' ' << help << '\n';
}

void gauge(const char* name, const char* help, uint64_t value) {
  family(name, "gauge", help);
  std::cout << name << ' ' << value << '\n';
}

// The buckets are cumulative, bounded by 1, 2, 4 ... microseconds, in seconds.
void histogramSamples(const char* name, const std::string& labels, const plist::Dictionary& d) {
  const std::string comma = labels.empty() ? "" : labels + ",";
  uint64_t cumulative = 0;
  const plist::Array& buckets = arrayOf(d, QRTStatusKeyBuckets);
  for (size_t i = 0; i < buckets.size(); ++i) {
    const plist::Integer* n = buckets[i].integerIf();
    cumulative += n ? n->asUnsigned() : 0;
    char bound[32];
    if (i + 1 == buckets.size())
      snprintf(bound, sizeof bound, "+Inf");
    else
      snprintf(bound, sizeof bound, "%g", static_cast<double>(uint64_t{1} << i) / 1e6);
    std::cout << name << "_bucket{" << comma << "le=\"" << bound << "\"} " << cumulative << '\n';
  }
  if (buckets.empty()) std::cout << name << "_bucket{" << comma << "le=\"+Inf\"} 0\n";
  char sum[48];
  snprintf(sum, sizeof sum, "%.6f", static_cast<double>(u64Of(d, QRTStatusKeySum)) / 1e6);
  const std::string braces = labels.empty() ? "" : "{" + labels + "}";
  std::cout << name << "_count" << braces << ' ' << cumulative << '\n'
            << name << "_sum" << braces << ' ' << sum << '\n';
}

void showMetrics(const qk::Reply& reply) {
  const plist::Dictionary& s = statusOf(reply);
  gauge("quarterd_uptime_seconds", "Seconds since the daemon started.", u64Of(s, QRTStatusKeyUptime));
  family("quarterd_containers", "gauge", "Containers in the cache, per class.");
  const plist::Array& perClass = arrayOf(s, QRTStatusKeyContainersPerClass);
  for (size_t c = 1; c < perClass.size(); ++c)
    if (const plist::Integer* n = perClass[c].integerIf())
      std::cout << "quarterd_containers{class=\"" << labelValue(className(c)) << "\"} " << n->asUnsigned() << '\n';
  gauge("quarterd_cache_bytes", "Approximate memory of the container cache.", u64Of(s, QRTStatusKeyCacheBytes));
  gauge("quarterd_deathrow_items", "Items waiting on death row.", u64Of(s, QRTStatusKeyDeathRowItems));
  gauge("quarterd_deathrow_bytes", "Bytes waiting on death row.", u64Of(s, QRTStatusKeyDeathRowBytes));
  gauge("quarterd_pending_protection_updates", "Protection-class changes not yet done.",
        u64Of(s, QRTStatusKeyPendingProtection));
  gauge("quarterd_identity_entries", "Entries of the identity registry.", u64Of(s, QRTStatusKeyIdentities));
  gauge("quarterd_identity_refused_files", "Identity registry files skipped.", u64Of(s, QRTStatusKeyIdentitiesRefused));
  gauge("quarterd_log_level", "The daemon's log level.", u64Of(s, QRTStatusKeyLogLevel));
  const plist::Array& requests = arrayOf(s, QRTStatusKeyRequests);
  family("quarterd_requests_failed", "counter", "Requests answered with an error, per command.");
  for (const plist::Value& v : requests) {
    const plist::Dictionary& d = dictionaryOf(v);
    std::cout << "quarterd_requests_failed_total{command=\"" << labelValue(nameOf(d)) << "\"} "
              << u64Of(d, QRTStatusKeyFailed) << '\n';
  }
  family("quarterd_request_duration_seconds", "histogram", "Time from a request's arrival to its reply, per command.");
  for (const plist::Value& v : requests) {
    const plist::Dictionary& d = dictionaryOf(v);
    histogramSamples("quarterd_request_duration_seconds", "command=\"" + labelValue(nameOf(d)) + "\"", d);
  }
  family("quarterd_upcall_duration_seconds", "histogram", "Time to serve a kernel upcall.");
  const plist::Value* upcalls = plist::find(s, QRTStatusKeyUpcalls);
  histogramSamples("quarterd_upcall_duration_seconds", "", upcalls ? dictionaryOf(*upcalls) : plist::Dictionary{});
  std::cout << "# EOF\n";
}

int logLevel(G g, A a) {
  if (a.words.size() != 1) throw UsageError{"log-level needs one LEVEL, 0 to 7"};
  const uint64_t level = parseUnsigned(a.words[0], "LEVEL");
  if (level > 7) throw UsageError{"LEVEL is larger than the limit of 7 (debug)"};
  return deliver(g, [&](qk::Connection& c) { return qk::setLogLevel(c, level); },
                 {[&](const qk::Reply& reply) {
                    std::cout << "log level " << level << " (was " << reply.u64(QRTReplyKeyLogLevel) << ")\n";
                  },
                  [&](const qk::Reply& reply) -> nlohmann::json {
                    return {{"level", level}, {"previous", reply.u64(QRTReplyKeyLogLevel)}};
                  }});
}

const Group kOperations{
    40,
    {
        {"status",
         "101",
         {},
         {},
         "Prints what the daemon is doing and how fast.\nUptime, cached containers per class, the death-row "
         "backlog, pending protection updates, the\nidentity registry, and per command the requests served and "
         "failed with their p50 and p99\nlatency, kernel upcalls alike.",
         [](G g, A) {
           return deliver(g, [](qk::Connection& c) { return qk::status(c); }, {showStatus, statusJson});
         }},
        {"metrics",
         "102",
         {},
         {},
         "Prints the daemon's figures in the OpenMetrics text format.\nLatencies are histograms in seconds; for "
         "node_exporter's textfile collector (see the README).",
         [](G g, A) { return deliver(g, [](qk::Connection& c) { return qk::metrics(c); }, {showMetrics}); }},
        {"log-level",
         "103",
         {},
         {},
         "Sets the running daemon's log level (0 to 7).\n7 adds one line per request served: command, caller, "
         "result and microseconds.",
         logLevel,
         "LEVEL"},
    }};

const Registration kRegistration(kOperations);

}  // namespace

}  // namespace ctl
