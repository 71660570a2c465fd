// q7ctl: the operator's command line for a running q7agent. Each command is one or two calls of
// the agent's HTTP API; the reply is printed as a table, CSV or JSON.

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <fstream>
#include <iostream>
#include <string>
#include <vector>

#include "tools/q7ctl/alerts.h"
#include "tools/q7ctl/client.h"
#include "tools/q7ctl/column_sets.h"
#include "tools/q7ctl/config.h"
#include "tools/q7ctl/format.h"
#include "tools/q7ctl/readable.h"
#include "tools/q7ctl/top.h"

namespace q7ctl {
namespace {

// Exit codes: 1 when the agent cannot be reached or refuses, 2 for a bad command line.
constexpr int kFailed = 1;
constexpr int kUsage = 2;

constexpr char kMainFooter[] =
    R"(Connection (unless --url and --token are given), as the agent itself looks it up:
  address  Q7_HTTP_ADDRESS from the environment, else from <configdir>q7.env, else the address
           the agent wrote to <home>logs/q7agent.addr, else 127.0.0.1:7420; https when the
           agent has a certificate (Q7_TLS_CERT), checked against --cacert or Q7_TLS_CACERT
  token    <configdir>q7_api_token, sent as "Authorization: Bearer <token>"
  home = $Q7_HOME or the parent of q7ctl's bin/; configdir = $Q7_CONFIG_DIR or <home>config/
Examples:
  q7ctl tables
  q7ctl sample Q7TXSM --where "APPLICATIN EQ Shop" -o csv
  q7ctl latency --by transaction
  q7ctl top
  q7ctl situation start Shop --table Q7TXPTNS APPLICATIN=Shop APPPATTERN='*' \
        TRANSACTN=Checkout TRANSPATTN='*/checkout*'
  q7ctl events --follow
  q7ctl alerts --follow
Exit status: 0 done, 1 the agent failed or could not be reached, 2 bad command line.
)";

struct Globals {
  std::string url;
  std::string token;
  std::string cacert;
  std::string output = "table";
  bool wide = false;
  bool raw = false;
};

int Fail(const Result& result) {
  std::cerr << "q7ctl: " << result.message() << '\n';
  return kFailed;
}

// The array reply[key], or a failure when the agent's reply does not have one.
Result ArrayField(const Json& reply, const char* key, Json* out) {
  if (!reply.is_object() || !reply.contains(key) || !(*out = reply[key]).is_array()) {
    return Result::Error(std::string("unexpected reply from the agent: no \"") + key + "\" array");
  }
  return Result::Ok();
}

// A condition as `situation start` takes it: COLUMN=VALUE for EQ, else "COLUMN OP VALUE".
std::string ConditionText(const Json& condition) {
  const std::string column = CellText(condition.value("column", Json()));
  const std::string op = CellText(condition.value("op", Json("EQ")));
  const std::string value = CellText(condition.value("value", Json()));
  return op == "EQ" ? column + "=" + value : column + " " + op + " " + value;
}

void SayNone(const FormatOptions& options, const char* what) {
  if (options.format == OutputFormat::kTable) {
    std::cerr << "(no " << what << ")\n";
  }
}

int Tables(ApiClient& client, const FormatOptions& options) {
  Json reply, tables;
  Result result = client.Get("/api/v1/tables", &reply);
  if (result.ok()) {
    result = ArrayField(reply, "tables", &tables);
  }
  if (!result.ok()) {
    return Fail(result);
  }
  Json rows = Json::array();
  for (const Json& table : tables) {
    if (!table.is_object()) {
      continue;
    }
    Json row = Json::object();
    row["name"] = table.value("name", Json());
    row["columns"] = table.contains("columns") ? table["columns"].size() : 0;
    rows.push_back(std::move(row));
  }
  WriteRows(rows, options, std::cout, tables);
  return 0;
}

// Which of a table's columns `sample` shows: --columns names them, --all asks for every one, and
// otherwise table output shows the table's default set, fitted to the line width.
struct ColumnChoice {
  std::vector<std::string> columns;
  bool all = false;
};

int Sample(ApiClient& client, const FormatOptions& options, const std::string& table,
           const std::vector<std::string>& wheres, std::optional<long> limit,
           const ColumnChoice& choice) {
  Json reply, rows;
  Result result = client.Get(SampleTarget(table, wheres, limit), &reply);
  if (result.ok()) {
    result = ArrayField(reply, "rows", &rows);
  }
  if (!result.ok()) {
    return Fail(result);
  }
  if (rows.empty()) {
    SayNone(options, "rows");
    return 0;
  }
  FormatOptions shown_options = options;
  Json shown = rows;
  std::vector<std::string> unknown;
  const bool defaults = choice.columns.empty() && !choice.all;
  if (!choice.columns.empty()) {
    shown = SelectColumns(rows, choice.columns, &unknown);
    if (!unknown.empty()) {
      std::string names;
      for (const std::string& name : ColumnsOf(rows)) {
        names += (names.empty() ? "" : ",") + name;
      }
      std::cerr << "q7ctl: " << table << " has no column \"" << unknown.front()
                << "\"; its columns: " << names << '\n';
      return kUsage;
    }
  } else if (defaults && options.format == OutputFormat::kTable) {
    const std::vector<std::string> set = DefaultColumns(table);
    if (!set.empty()) {
      shown = SelectColumns(rows, set, &unknown);
    }
    shown_options.max_line = kDefaultLineWidth;
  }
  const std::size_t hidden =
      WriteRows(options.readable ? ReadableRows(shown) : shown, shown_options, std::cout);
  const std::size_t total = ColumnsOf(rows).size();
  const std::size_t printed = ColumnsOf(shown).size() - hidden;
  if (defaults && options.format == OutputFormat::kTable && printed < total &&
      ::isatty(STDERR_FILENO) != 0) {
    std::cerr << "(" << printed << " of " << total
              << " columns; --all shows every one, --columns A,B,... chooses)\n";
  }
  return 0;
}

int Latency(ApiClient& client, const FormatOptions& options, const std::string& by,
            const std::string& window, const std::vector<std::string>& wheres) {
  Json reply, rows;
  Result result = client.Get(LatencyTarget(by, window, wheres), &reply);
  if (result.ok()) {
    result = ArrayField(reply, "rows", &rows);
  }
  if (!result.ok()) {
    return Fail(result);
  }
  if (rows.empty()) {
    SayNone(options, "requests in the window");
  }
  WriteRows(rows, options, std::cout, reply);
  return 0;
}

int SituationList(ApiClient& client, const FormatOptions& options) {
  Json reply, situations;
  Result result = client.Get("/api/v1/situations", &reply);
  if (result.ok()) {
    result = ArrayField(reply, "situations", &situations);
  }
  if (!result.ok()) {
    return Fail(result);
  }
  Json rows = Json::array();
  for (const Json& situation : situations) {
    if (!situation.is_object()) {
      continue;
    }
    std::string conditions;
    for (const Json& condition : situation.value("conditions", Json::array())) {
      if (!condition.is_object()) {
        continue;
      }
      conditions += (conditions.empty() ? "" : " ") + ConditionText(condition);
    }
    Json row = Json::object();
    row["name"] = situation.value("name", Json());
    row["table"] = situation.value("table", Json());
    row["conditions"] = conditions;
    rows.push_back(std::move(row));
  }
  if (rows.empty()) {
    SayNone(options, "situations started");
  }
  WriteRows(rows, options, std::cout, situations);
  return 0;
}

// The situation in a JSON file, as PUT takes it: {"table", "conditions", "every", ...}.
int SituationStartFromFile(ApiClient& client, const std::string& name, const std::string& path) {
  std::ifstream in(path);
  const Json body = Json::parse(in, nullptr, false);
  if (!in.is_open() || body.is_discarded() || !body.is_object()) {
    std::cerr << "q7ctl: " << path << " is not a JSON object of a situation\n";
    return kUsage;
  }
  Json reply;
  const Result result = client.Put(SituationTarget(name), body, &reply);
  if (!result.ok()) {
    return Fail(result);
  }
  std::cout << "situation " << name << " started on " << body.value("table", "?") << " from "
            << path << '\n';
  return 0;
}

int SituationStart(ApiClient& client, const std::string& name, const std::string& table,
                   const std::vector<std::string>& words) {
  Json conditions = Json::array();
  for (const std::string& word : words) {
    Json condition;
    std::string error;
    if (!ParseCondition(word, &condition, &error)) {
      std::cerr << "q7ctl: " << error << '\n';  // the command line checked it already
      return kUsage;
    }
    conditions.push_back(std::move(condition));
  }
  Json reply;
  const Result result = client.Put(SituationTarget(name), SituationBody(table, conditions), &reply);
  if (!result.ok()) {
    return Fail(result);
  }
  std::cout << "situation " << name << " started on " << table << " with " << conditions.size()
            << (conditions.size() == 1 ? " condition" : " conditions") << '\n';
  return 0;
}

int SituationStop(ApiClient& client, const std::string& name) {
  Json reply;
  const Result result = client.Delete(SituationTarget(name), &reply);
  if (!result.ok()) {
    return Fail(result);
  }
  std::cout << "situation " << name << " stopped\n";
  return 0;
}

int Events(ApiClient& client, const FormatOptions& options, bool follow) {
  Json reply, events;
  Result result = client.Get("/api/v1/events", &reply);
  if (result.ok()) {
    result = ArrayField(reply, "events", &events);
  }
  if (!result.ok()) {
    return Fail(result);
  }
  // Alert changes travel with the rows; `q7ctl alerts` shows them in columns of their own.
  Json rows = Json::array();
  for (const Json& event : events) {
    if (!IsAlertChange(event)) {
      rows.push_back(event);
    }
  }
  events = std::move(rows);
  if (!follow) {
    if (events.empty()) {
      SayNone(options, "events");
    }
    WriteRows(options.readable ? ReadableRows(events) : events, options, std::cout);
    return 0;
  }
  StreamWriter writer(options, std::cout);
  writer.Begin(options.readable ? ReadableRows(events) : events);
  // Runs until the agent ends the stream or the operator interrupts q7ctl.
  return Fail(client.Stream("/api/v1/events/stream", [&writer, &options](const Json& event) {
    if (!IsAlertChange(event)) {
      writer.Write(options.readable ? ReadableRows(Json::array({event}))[0] : event);
    }
    return true;
  }));
}

int Alerts(ApiClient& client, const FormatOptions& options, bool recent, bool follow, bool raw) {
  Json reply, items;
  Result result = client.Get("/api/v1/alerts", &reply);
  if (result.ok()) {
    result = ArrayField(reply, recent ? "recent" : "open", &items);
  }
  if (!result.ok()) {
    return Fail(result);
  }
  const Json rows = recent ? AlertChangeRows(items, raw) : OpenAlertRows(items, raw);
  if (!follow) {
    if (rows.empty()) {
      SayNone(options, recent ? "alert changes kept" : "open alerts");
    }
    WriteRows(rows, options, std::cout, options.format == OutputFormat::kJson ? items : Json());
    return 0;
  }
  // Then each change as it comes, from the events stream, which carries table rows too.
  StreamWriter writer(options, std::cout);
  writer.Begin(rows);
  return Fail(client.Stream("/api/v1/events/stream", [&](const Json& event) {
    if (IsAlertChange(event)) {
      writer.Write(options.format == OutputFormat::kJson
                       ? event
                       : AlertChangeRows(Json::array({event}), raw)[0]);
    }
    return true;
  }));
}

// Footer of a command's help: its examples, then the options every command takes.
std::string Help(const std::string& examples) {
  return examples +
         "\nOptions of every command (before or after it): --url URL, --token TOKEN,\n"
         "  -o table|json|csv, --wide; q7ctl --help tells how the agent is found.\n";
}

CLI::Validator ConditionValidator() {
  return CLI::Validator(
      [](std::string& word) {
        Json condition;
        std::string error;
        return ParseCondition(word, &condition, &error) ? std::string() : error;
      },
      "COLUMN=VALUE");
}

int Run(int argc, char** argv) {
  CLI::App app{"q7ctl: operator command line for a running q7agent (its HTTP API)", "q7ctl"};
  app.set_version_flag("--version", std::string("q7ctl ") + Q7_VERSION_TEXT);
  app.require_subcommand(1);
  app.fallthrough();  // subcommands inherit it: the options below may follow the command
  app.footer(kMainFooter);
  Globals globals;
  app.add_option("--url", globals.url, "Agent address, http://host:port (default: looked up)");
  app.add_option("--token", globals.token, "API token (default: <configdir>q7_api_token)");
  app.add_option("--cacert", globals.cacert,
                 "HTTPS: PEM file of the CA, or the self-signed certificate, that signed the "
                 "agent's certificate (default: Q7_TLS_CACERT, else the system's CAs)");
  app.add_option("-o,--output", globals.output, "Output format: table, json or csv")
      ->check(CLI::IsMember({"table", "json", "csv"}))
      ->capture_default_str();
  app.add_flag("--wide", globals.wide, "Table output: do not cut long text columns");
  app.add_flag("--raw", globals.raw,
               "Table and CSV output: keep the agent's values as they are (timestamps as "
               "CYYMMDDHHMMSSmmm, percentages in thousandths), as JSON output always does");

  CLI::App* tables = app.add_subcommand("tables", "List the agent's tables in load order");
  tables->footer(Help("Example:\n  q7ctl tables\n  q7ctl tables -o json   # with every column"));

  CLI::App* sample = app.add_subcommand("sample", "Take one sample of a table");
  std::string table;
  std::vector<std::string> wheres;
  long limit = 0;
  sample->add_option("TABLE", table, "Table name, e.g. Q7TXSM")->required();
  sample
      ->add_option("--where", wheres,
                   "Filter \"COLUMN OP VALUE\", OP one of EQ NE LT LE GT GE (repeatable; all "
                   "must hold)")
      ->expected(1)
      ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
  CLI::Option* limit_option =
      sample->add_option("--limit", limit, "At most N rows")->check(CLI::NonNegativeNumber);
  ColumnChoice column_choice;
  CLI::Option* columns_option =
      sample
          ->add_option("--columns", column_choice.columns,
                       "Columns to show, in this order, comma-separated (any output format; "
                       "names in any case)")
          ->delimiter(',');
  sample
      ->add_flag("--all", column_choice.all,
                 "Every column (table output otherwise shows the table's main columns, "
                 "trimmed to 120 characters)")
      ->excludes(columns_option);
  sample->footer(Help(
      "Examples:\n"
      "  q7ctl sample Q7AGNTDTS\n"
      "  q7ctl sample Q7APPSM --columns applicatin,totreq,pcfail,oatime\n"
      "  q7ctl sample Q7TXINS --all --wide\n"
      "  q7ctl sample Q7TXSM --where \"APPLICATIN EQ Shop\" --where \"TOTREQ GT 10\" --limit 5\n"
      "  q7ctl sample Q7TXSM -o csv > q7txsm.csv"));

  CLI::App* latency = app.add_subcommand(
      "latency",
      "Percentiles (p50, p90, p95, p99), maximum and apdex per application or transaction");
  std::string by = "application";
  std::string window = "summary";
  std::vector<std::string> latency_wheres;
  latency->add_option("--by", by, "Key: application or transaction")
      ->check(CLI::IsMember({"application", "transaction"}))
      ->capture_default_str();
  latency
      ->add_option("--window", window,
                   "interval (the current over-time interval) or summary (the summary period, "
                   "24 hours by default)")
      ->check(CLI::IsMember({"interval", "summary"}))
      ->capture_default_str();
  latency->add_option("--where", latency_wheres,
                      "Filter \"COLUMN OP VALUE\" on a column of the answer (OP: EQ NE LT LE GT "
                      "GE); repeat to AND");
  latency->footer(Help(
      "Times are in milliseconds, within 1 % of the exact percentile; apdex counts requests\n"
      "within the threshold T as satisfied and within 4T as tolerating.\n"
      "Examples:\n"
      "  q7ctl latency\n"
      "  q7ctl latency --by transaction --where \"application EQ Shop\" --where \"p95_ms GT 500\"\n"
      "  q7ctl latency --window interval -o csv"));

  CLI::App* top = app.add_subcommand(
      "top", "Live view of the busiest or slowest applications and transactions");
  TopOptions top_options;
  top->add_option("-n,--interval", top_options.interval_seconds, "Seconds between refreshes")
      ->check(CLI::Range(0.1, 3600.0))
      ->capture_default_str();
  top->add_flag("--summary", top_options.view.summary,
                "Start on the summary period instead of the current interval (key w)");
  top->add_flag("--slowest", top_options.view.slowest,
                "Start with the slowest first (by p95) instead of the busiest (key s)");
  top->add_flag("--once", top_options.once,
                "Print one screen and exit (also what happens when the output is not a "
                "terminal)");
  top->footer(
      Help("Keys: w switches between the current interval and the summary period, s between\n"
           "busiest and slowest first, q (or Ctrl-C) quits; any other key refreshes at once.\n"
           "Examples:\n"
           "  q7ctl top\n"
           "  q7ctl top --summary --slowest -n 5\n"
           "  q7ctl top --once > snapshot.txt"));

  CLI::App* situation = app.add_subcommand("situation", "List, start or stop situations");
  situation->require_subcommand(1);
  CLI::App* list = situation->add_subcommand("list", "List the started situations");
  list->footer(Help("Example:\n  q7ctl situation list"));
  CLI::App* start = situation->add_subcommand("start", "Start a situation on a pattern table");
  std::string name, situation_table;
  std::vector<std::string> words;
  std::string situation_file;
  start->add_option("NAME", name, "Situation name")->required();
  CLI::Option* table_option =
      start->add_option("--table", situation_table, "Table the situation runs on, e.g. Q7TXPTNS");
  CLI::Option* words_option =
      start
          ->add_option("CONDITIONS", words,
                       "COLUMN=VALUE words, each one EQ condition, in order (a column may repeat: "
                       "a pattern table reads complete sets of conditions)")
          ->check(ConditionValidator());
  CLI::Option* file_option =
      start
          ->add_option("--file", situation_file,
                       "The situation as JSON, as the API takes it: {\"table\", \"conditions\": "
                       "[{\"column\", \"op\", \"value\"}], and for alerts \"every\", \"for\", "
                       "\"severity\", \"webhook\"}")
          ->check(CLI::ExistingFile);
  file_option->excludes(table_option)->excludes(words_option);
  table_option->needs(words_option);
  words_option->needs(table_option);
  start->footer(
      Help("Examples:\n"
           "  q7ctl situation start Shop --table Q7TXPTNS APPLICATIN=Shop APPPATTERN='*' \\\n"
           "        TRANSACTN=Checkout TRANSPATTN='*/checkout*'\n"
           "  q7ctl situation start AppAvailability --file app-availability.json   # an alert\n"
           "The value is everything after the first '=', so it may hold '=' itself."));
  CLI::App* stop = situation->add_subcommand("stop", "Stop a situation");
  stop->add_option("NAME", name, "Situation name")->required();
  stop->footer(Help("Example:\n  q7ctl situation stop Shop"));

  CLI::App* alerts = app.add_subcommand("alerts", "Show the open alerts, or the recent changes");
  bool alerts_recent = false;
  bool alerts_follow = false;
  alerts->add_flag("--recent", alerts_recent,
                   "The last changes (raised, cleared), oldest first, instead of the open alerts");
  alerts->add_flag("-f,--follow", alerts_follow,
                   "Then print each change as it happens, until interrupted");
  alerts->footer(Help(
      "Alerts come from situations on row tables, which the agent samples every \"every\"\n"
      "seconds; a key raises after \"for\" matching samples and clears when it stops matching.\n"
      "Examples:\n"
      "  q7ctl alerts\n"
      "  q7ctl alerts --recent -o csv\n"
      "  q7ctl alerts --follow"));

  CLI::App* events = app.add_subcommand("events", "Show the agent's recent data events");
  bool follow = false;
  events->add_flag("-f,--follow", follow,
                   "Then print each new event as it arrives, until interrupted (JSON output: "
                   "one object per line)");
  events->footer(Help("Examples:\n  q7ctl events\n  q7ctl events --follow -o csv"));

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int code = app.exit(e);
    return code == 0 ? 0 : kUsage;  // --help and --version are successes too
  }

  FormatOptions options;
  ParseOutputFormat(globals.output, &options.format);
  options.wide = globals.wide;
  options.readable = !globals.raw && options.format != OutputFormat::kJson;
  Connection connection;
  std::string error;
  if (!ResolveConnection(Environment::Process(), globals.url, globals.token, globals.cacert,
                         &connection, &error)) {
    std::cerr << "q7ctl: " << error << '\n';
    return kFailed;
  }
  ApiClient client(connection.url, connection.token, connection.ca_certificate);

  if (tables->parsed()) {
    return Tables(client, options);
  }
  if (sample->parsed()) {
    return Sample(client, options, table, wheres,
                  limit_option->count() > 0 ? std::optional<long>(limit) : std::nullopt,
                  column_choice);
  }
  if (latency->parsed()) {
    return Latency(client, options, by, window, latency_wheres);
  }
  if (top->parsed()) {
    return RunTop(client, connection.url, top_options);
  }
  if (alerts->parsed()) {
    return Alerts(client, options, alerts_recent, alerts_follow, globals.raw);
  }
  if (list->parsed()) {
    return SituationList(client, options);
  }
  if (start->parsed()) {
    if (!situation_file.empty()) {
      return SituationStartFromFile(client, name, situation_file);
    }
    if (situation_table.empty()) {
      std::cerr << "q7ctl: situation start needs --table and CONDITIONS, or --file\n";
      return kUsage;
    }
    return SituationStart(client, name, situation_table, words);
  }
  if (stop->parsed()) {
    return SituationStop(client, name);
  }
  return Events(client, options, follow);
}

}  // namespace
}  // namespace q7ctl

int main(int argc, char** argv) {
  return q7ctl::Run(argc, argv);
}
