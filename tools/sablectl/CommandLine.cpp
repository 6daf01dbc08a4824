#include "tools/sablectl/CommandLine.h"

#include <CLI/CLI.hpp>
#include <memory>

#include "SableKit/SBLRelayCoding.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/FeedbackFields.h"
#include "tools/sablectl/RequestRecord.h"

namespace sable::sablectl {
namespace {

/// Adds a subcommand that runs `command`, which owns what its options are read into.
CLI::App& add(CLI::App& app, Invocation& invocation, const char* name, const char* description,
              Command command) {
  CLI::App& subcommand = *app.add_subcommand(name, description);
  subcommand.callback([&invocation, command = std::move(command)] { invocation.command = command; });
  return subcommand;
}

std::string checkNameAndValue(const std::string& word) {
  const auto pair = nameAndValue(word);
  return pair ? std::string() : pair.error().reason;
}

void addRequestOptions(CLI::App& command, SBLRequest& request) {
  request.queryId = 1;
  request.verboseReply = true;
  command.add_option("--query-id", request.queryId, "The query's id; 1 unless given")->type_name("N");
  command.add_option("--trigger", request.triggerEvent, "What made the client ask")->type_name("N");
  command.add_option("--scale", request.scale, "Pixels per point of the client's screen")
      ->type_name("S")
      ->check(CLI::PositiveNumber);
  command
      .add_option_function<std::vector<std::string>>(
          "--item",
          [&request](const std::vector<std::string>& words) {
            for (const std::string& word : words) {
              auto [name, value] = *nameAndValue(word);
              request.queryItems.push_back({std::move(name), std::move(value)});
            }
          },
          "Forces a query item on the request to the service (repeatable)")
      ->type_name("NAME=VALUE")
      ->allow_extra_args(false)
      ->check(CLI::Validator(checkNameAndValue, ""));
  command.add_flag_callback(
      "--no-verbose", [&request] { request.verboseReply = false; },
      "Do not ask for the HTTP request and response");
}

/// Adds a subcommand that sends one request; its options are read into the request.
template <class Request>
CLI::App& addRequest(CLI::App& app, Invocation& invocation, const char* name, const char* description,
                     const std::shared_ptr<Request>& request) {
  CLI::App& command = add(app, invocation, name, description, [request](const Context& context) {
    return runRequest(context, std::string(Request::kClassName), encodeRequest(*request));
  });
  addRequestOptions(command, *request);
  return command;
}

void addText(CLI::App& command, const char* name, std::string& value, const char* description) {
  command.add_option(name, value, description)->required()->type_name("");
}

void addSearches(CLI::App& app, Invocation& invocation) {
  const auto search = std::make_shared<SBLSearchRequest>();
  addText(addRequest(app, invocation, "search", "Search once", search), "TEXT", search->queryString,
          "What to search");

  const auto typed = std::make_shared<SBLSearchRequest>();
  CLI::App& type = add(app, invocation, "type", "Search at every keystroke, on one connection",
                       [typed](const Context& context) { return runType(context, *typed); });
  addRequestOptions(type, *typed);
  addText(type, "TEXT", typed->queryString, "What to type");

  const auto explained = std::make_shared<SBLSearchRequest>();
  const auto before = std::make_shared<std::string>();
  CLI::App& explain =
      add(app, invocation, "explain", "Say what a search would do, and why",
          [explained, before](const Context& context) { return runExplain(context, *explained, *before); });
  addRequestOptions(explain, *explained);
  explain.add_option("--after", *before, "Search this first, so that the cache has its answer")
      ->type_name("TEXT");
  addText(explain, "TEXT", explained->queryString, "What would be searched");

  addRequest(app, invocation, "zkw", "Ask what to offer before anything is typed",
             std::make_shared<SBLZeroKeywordRequest>());

  const auto more = std::make_shared<SBLMoreResultsRequest>();
  addText(addRequest(app, invocation, "more", "Ask for more results", more), "URL", more->moreResultsURL,
          "A result's URL of more results");

  const auto card = std::make_shared<SBLCardRequest>();
  addText(addRequest(app, invocation, "card", "Ask for a card", card), "URL", card->cardURL,
          "A result's URL of its card");
}

void addLookups(CLI::App& app, Invocation& invocation) {
  const auto lookup = std::make_shared<SBLLookupRequest>();
  CLI::App& command = addRequest(app, invocation, "lookup", "Look a selected text up", lookup);
  addText(command, "TEXT", lookup->queryString, "The selected text");
  command
      .add_option_function<std::string>(
          "--context", [lookup](const std::string& text) { lookup->queryContext = text; },
          "The text around it")
      ->type_name("C");
  command.add_option("--app", lookup->appBundleId, "The application it was selected in")->type_name("ID");
  command.add_option("--domain", lookup->domain, "The domain it was selected in")->type_name("D");
  command.add_option("--selection", lookup->lookupSelectionType, "How it was selected")->type_name("N");

  const auto search = std::make_shared<SBLFlightSearchRequest>();
  const auto lookUp = std::make_shared<bool>(false);
  CLI::App& flight =
      add(app, invocation, "flight", "Ask for a flight", [search, lookUp](const Context& context) {
        if (!*lookUp)
          return runRequest(context, std::string(SBLFlightSearchRequest::kClassName), encodeRequest(*search));
        SBLFlightLookupRequest request{*search, search->queryString};
        return runRequest(context, std::string(request.kClassName), encodeRequest(request));
      });
  addRequestOptions(flight, *search);
  addText(flight, "TEXT", search->queryString, "The flight");
  flight.add_flag("--lookup", *lookUp, "As the lookup of a flight, not as its search");
}

void addImages(CLI::App& app, Invocation& invocation) {
  const auto options = std::make_shared<ImageOptions>();
  CLI::App& command = *app.add_subcommand("images", "Load images that answers have named");
  const auto collect = [&](auto member) {
    return [options, member](const std::vector<std::string>& words) {
      for (const std::string& word : words) (options->descriptions.emplace_back().*member) = word;
    };
  };
  command
      .add_option_function<std::vector<std::string>>("URL", collect(&SBLImageDescription::url),
                                                     "Where images are")
      ->type_name("");
  command
      .add_option_function<std::vector<std::string>>("--id", collect(&SBLImageDescription::id),
                                                     "The bag's name of an image (repeatable)")
      ->type_name("ID")
      ->allow_extra_args(false);
  command.add_option("--save", options->save, "Write the images into this folder")->type_name("DIR");
  command.callback([&invocation, options] {
    if (options->descriptions.empty()) throw CLI::RequiredError("a URL or --id");
    invocation.command = [options](const Context& context) { return runImages(context, *options); };
  });
}

void addAnyRequest(CLI::App& app, Invocation& invocation) {
  struct Words {
    std::string className;
    std::vector<std::string> members;
    platform::RelayRecord record;
  };
  const auto words = std::make_shared<Words>();
  CLI::App& command = *app.add_subcommand("request", "Send any request record");
  addText(command, "CLASS", words->className, "The record's class");
  command.add_option("MEMBER", words->members, "Members as NAME=VALUE; queryItems.NAME=VALUE adds an item")
      ->type_name("");
  command.callback([&invocation, words] {
    auto record = requestRecord(words->members);
    if (!record) throw CLI::ValidationError(record.error().reason);
    invocation.command = [words, record = std::move(*record)](const Context& context) {
      return runRequest(context, words->className, record);
    };
  });
}

void addQuestions(CLI::App& app, Invocation& invocation) {
  add(app, invocation, "privacy", "Show what requests tell of this device now, and what changes that",
      runPrivacy);
  add(app, invocation, "bag", "Show the bag as this agent sees it", runBag);
  add(app, invocation, "sessions", "List the sessions that the daemon holds open", runSessions);

  struct Resource {
    std::string identifier;
    std::filesystem::path save;
  };
  const auto resource = std::make_shared<Resource>();
  CLI::App& command =
      add(app, invocation, "resource", "Get a resource file", [resource](const Context& context) {
        return runResource(context, resource->identifier,
                           resource->save.empty() ? std::nullopt : std::optional(resource->save));
      });
  addText(command, "ID", resource->identifier, "The resource's identifier");
  command.add_option("--save", resource->save, "Write the file's content there")->type_name("F");
  add(app, invocation, "resources", "List the resource files, and when they are fetched", runResources);

  const auto openMetrics = std::make_shared<bool>(false);
  add(app, invocation, "counters", "Show the daemon's counters", [openMetrics](const Context& context) {
    return runCounters(context, *openMetrics);
  }).add_flag("--openmetrics", *openMetrics, "As OpenMetrics text");
  add(app, invocation, "ledger", "Show what became of every feedback record", runLedger);
  add(app, invocation, "status", "Show what the daemon is, has and holds", runStatus);

  const auto shown = std::make_shared<std::int64_t>(0);
  add(app, invocation, "uploads", "List uploads under way and the last ones",
      [shown](const Context& context) {
        return *shown == 0 ? runUploads(context) : runShowUpload(context, *shown);
      })
      .add_option("--show", *shown, "Print the JSON that this upload carries")
      ->type_name("ID")
      ->check(CLI::PositiveNumber);
}

void addReport(CLI::App& app, Invocation& invocation) {
  struct Words {
    std::vector<std::string> fields;
    std::filesystem::path file;
    FeedbackReport report;
  };
  const auto words = std::make_shared<Words>();
  CLI::App& command = *app.add_subcommand("report", "Report a feedback");
  addText(command, "CLASS", words->report.className, "The message's class (RKStartSearchFeedback)");
  auto* fields = command.add_option("FIELD", words->fields, "Fields as NAME=VALUE, in protobuf's JSON form");
  fields->type_name("");
  command.add_option("--file", words->file, "Read the message from this file, in that form")
      ->type_name("F")
      ->excludes(fields);
  command.add_option("--query-id", words->report.queryId, "The service's query that it belongs to")
      ->type_name("N");
  command.callback([&invocation, words] {
    auto bytes = words->file.empty() ? feedbackFromFields(words->report.className, words->fields)
                                     : feedbackFromFile(words->report.className, words->file);
    if (!bytes) throw CLI::ValidationError(bytes.error().reason);
    words->report.bytes = std::move(*bytes);
    invocation.command = [words](const Context& context) { return runReport(context, words->report); };
  });
}

void addFeedback(CLI::App& app, Invocation& invocation) {
  addReport(app, invocation);
  add(app, invocation, "feedback", "Show the feedback that sessions hold in memory", runFeedback);
  const auto path = std::make_shared<std::filesystem::path>();
  CLI::App& session = add(app, invocation, "session", "Show what a session file holds",
                          [path](const Context& context) { return runSessionFile(context, *path); });
  session.add_option("FILE", *path, "The file")->required()->type_name("");
}

void addFlusher(CLI::App& app, Invocation& invocation) {
  const auto sent = std::make_shared<bool>(false);
  add(app, invocation, "watch", "Show feedback as it is added", [sent](const Context& context) {
    return runWatch(context, *sent);
  }).add_flag("--sent", *sent, "Sessions as they are uploaded, in place of feedback");
  add(app, invocation, "stop", "Upload nothing until the next dump", runStop);
  add(app, invocation, "dump", "End all sessions, upload them, and go on uploading", runDump);
}

void addOptions(CLI::App& app, Options& options) {
  app.add_option("--socket", options.socket, "The daemon's socket")->type_name("PATH");
  app.add_option("--identifier", options.identifier, "The client's identifier")
      ->capture_default_str()
      ->type_name("ID");
  app.add_option("--agent", options.agent, "The client's user agent")->capture_default_str()->type_name("UA");
  app.add_option("--timeout", options.timeout, "How long to wait for an answer")
      ->capture_default_str()
      ->type_name("SECONDS")
      ->check(CLI::Range(0.001, 86400.0));
  app.add_flag("--json", options.json, "Print JSON");
}

}  // namespace

std::variant<Invocation, ExitCode> readCommandLine(int argc, const char* const* argv) {
  Invocation invocation;
  CLI::App app("Asks sabled as any program that searches would, and looks into it.", "sablectl");
  app.require_subcommand(1);
  app.fallthrough();
  addOptions(app, invocation.options);
  addSearches(app, invocation);
  addLookups(app, invocation);
  addImages(app, invocation);
  addAnyRequest(app, invocation);
  addQuestions(app, invocation);
  addFeedback(app, invocation);
  addFlusher(app, invocation);
  try {
    app.parse(argc, argv);
  } catch (const CLI::Success& success) {
    return app.exit(success) == 0 ? kExitSuccess : kExitUsage;
  } catch (const CLI::ParseError& error) {
    complain(error.what());
    return kExitUsage;
  }
  return invocation;
}

}  // namespace sable::sablectl
