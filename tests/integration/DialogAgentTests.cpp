// Dialogs end to end: larderd on a private bus, dialog agents played by
// `larderctl agent`, dialogs asked for with `larderctl dialog` or over the
// bus.
#include <gtest/gtest.h>

#include <signal.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IProxy.h>

#include "client/DialogAgentProtocol.h"
#include "tests/integration/LarderctlProcess.h"
#include "tests/integration/ServiceHarness.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

std::string sourcePath(const std::string& relative) {
  return (fs::path(LARDER_SOURCE_DIR) / relative).string();
}

// The methods of one interface in an introspection document, one line per
// method with its arguments and annotations, sorted by method name, so that
// two documents that differ only in layout and order compare equal.
std::vector<std::string> describeInterface(const std::string& xml, const std::string& name) {
  const std::string opening = "<interface name=\"" + name + "\">";
  const std::size_t start = xml.find(opening);
  if (start == std::string::npos) return {};
  const std::string body = xml.substr(start, xml.find("</interface>", start) - start);
  static const std::regex method(R"re(<method name="([^"]+)">([\s\S]*?)</method>)re");
  static const std::regex element(R"re(<(arg|annotation)\s+([^>]*?)/>)re");
  static const std::regex attribute(R"re((\w+)="([^"]*)")re");
  std::vector<std::string> methods;
  for (std::sregex_iterator m(body.begin(), body.end(), method), end; m != end; ++m) {
    std::string line = (*m)[1].str() + ":";
    const std::string inner = (*m)[2].str();
    for (std::sregex_iterator e(inner.begin(), inner.end(), element); e != end; ++e) {
      std::map<std::string, std::string> attributes;
      const std::string text = (*e)[2].str();
      for (std::sregex_iterator a(text.begin(), text.end(), attribute); a != end; ++a) {
        attributes[(*a)[1].str()] = (*a)[2].str();
      }
      if ((*e)[1].str() == "arg") {
        line += " " + attributes["direction"] + " " + attributes["type"] + " " + attributes["name"];
      } else {
        line += " @" + attributes["name"] + "=" + attributes["value"];
      }
    }
    methods.push_back(line);
  }
  std::ranges::sort(methods);
  return methods;
}

// The introspection document of the object at `path` of `destination`.
std::string introspect(sdbus::IConnection& connection, const std::string& destination,
                       const std::string& path) {
  auto proxy = sdbus::createProxy(connection, destination, path);
  std::string xml;
  proxy->callMethod("Introspect")
      .onInterface("org.freedesktop.DBus.Introspectable")
      .storeResultsTo(xml);
  return xml;
}

class DialogAgentTest : public ::testing::Test {
 protected:
  void SetUp() override {
    service_ = std::make_unique<ServiceProcess>(platform_, bus_);
    ASSERT_TRUE(service_->waitUntilServing()) << service_->log();
  }

  // An agent that has registered with the service.
  std::unique_ptr<Larderctl> startAgent(const std::vector<std::string>& options) {
    std::vector<std::string> arguments{"agent"};
    arguments.insert(arguments.end(), options.begin(), options.end());
    auto agent = std::make_unique<Larderctl>(platform_, bus_, arguments,
                                             "agent-" + std::to_string(++processes_));
    EXPECT_TRUE(agent->waitForError("registered")) << agent->errors() << service_->log();
    return agent;
  }

  std::unique_ptr<Larderctl> startDialog(const std::vector<std::string>& options,
                                         bool json = false) {
    std::vector<std::string> arguments;
    if (json) arguments.push_back("--json");
    arguments.push_back("dialog");
    arguments.insert(arguments.end(), options.begin(), options.end());
    return std::make_unique<Larderctl>(platform_, bus_, arguments,
                                       "dialog-" + std::to_string(++processes_));
  }

  // Runs `larderctl dialog` to its end; its output, or "<hung>".
  std::string dialogOutput(const std::vector<std::string>& options, bool json = false) {
    auto dialog = startDialog(options, json);
    if (!dialog->waitForExit()) return "<hung>";
    EXPECT_EQ(dialog->process().wait(), 0) << dialog->errors();
    return dialog->output();
  }

  std::string agentName(Larderctl& agent) const {
    std::smatch match;
    const std::string errors = agent.errors();
    static const std::regex registered(R"re(dialog agent (\S+) (\S+) registered)re");
    return std::regex_search(errors, match, registered) ? match[1].str() : std::string();
  }

  TemporaryPlatform platform_;
  PrivateBus bus_;
  std::unique_ptr<ServiceProcess> service_;
  int processes_ = 0;
};

// One agent or none, one dialog: what the dialog prints, what the agent
// says. Malformed requests first, which the registry shrugs off.
TEST_F(DialogAgentTest, TheAgentsAnswerIsTheDialogsExitCode) {
  auto connection = bus_.connect();
  auto service = sdbus::createProxy(*connection, "com.orvane.larderd", "/com/orvane/larderd");
  const std::string registry(DialogAgentProtocol::kRegistryInterfaceName);
  EXPECT_THROW(service->callMethod("RegisterDialogAgent")
                   .onInterface(registry)
                   .withArguments(std::string("not a path")),
               sdbus::Error);
  EXPECT_THROW(
      service->callMethod("DisplayDialog").onInterface(registry).withArguments(std::int64_t{1}),
      sdbus::Error);

  struct Case {
    std::vector<std::string> agent;  // empty: no agent
    std::vector<std::string> dialog;
    bool json;
    std::string printed;
    std::string answered;
  };
  const std::vector<Case> cases{
      {{}, {"--message", "Anyone there?", "--ok", "Yes"}, false, "0\n", ""},
      {{"--answer", "ok"},
       {"--message", "Restart now?", "--explanation", "Updates are ready.", "--ok", "Restart",
        "--cancel", "Later"},
       false,
       "1\n",
       "answered 1 (Restart) to \"Restart now?\"\n"},
      {{"--answer", "other"},
       {"--message", "Quit Foo?", "--ok", "Quit", "--cancel", "Cancel", "--other", "Skip"},
       true,
       "{\"exitCode\":2,\"values\":{}}\n",
       "answered 2 (Skip) to \"Quit Foo?\"\n"},
  };
  std::size_t agentsGone = 0;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.dialog[1]);
    std::unique_ptr<Larderctl> agent;
    if (!c.agent.empty()) {
      std::vector<std::string> options = c.agent;
      options.insert(options.end(), {"--count", "1"});
      agent = startAgent(options);
    }
    const auto started = Clock::now();
    EXPECT_EQ(dialogOutput(c.dialog, c.json), c.printed);
    if (!agent) {
      EXPECT_LT(Clock::now() - started, 5s) << "cancelled at once";
      EXPECT_TRUE(service_->waitForLog("No dialog agent")) << service_->log();
      continue;
    }
    ASSERT_TRUE(agent->waitForExit()) << "--count 1 ends the agent after one dialog";
    EXPECT_EQ(agent->process().wait(), 0);
    EXPECT_EQ(agent->output(), c.answered);
    ++agentsGone;
    ASSERT_TRUE(eventually([&] { return service_->logLines("unregistered").size() == agentsGone; }))
        << service_->log();
  }
}

TEST_F(DialogAgentTest, AnAgentRegistersAgainWhenTheServiceRestarts) {
  auto agent = startAgent({"--answer", "ok", "--count", "1"});
  service_->stop();
  service_ = std::make_unique<ServiceProcess>(platform_, bus_);
  ASSERT_TRUE(service_->waitUntilServing()) << service_->log();
  ASSERT_TRUE(eventually([&] {
    const std::string errors = agent->errors();
    const auto first = errors.find("registered");
    return first != std::string::npos && errors.find("registered", first + 1) != std::string::npos;
  })) << agent->errors();
  EXPECT_EQ(dialogOutput({"--message", "Still there?", "--ok", "Yes"}), "1\n")
      << "the restarted service finds the agent" << service_->log();
  EXPECT_TRUE(agent->waitForExit());
}

TEST_F(DialogAgentTest, AnAgentThatDiesWhileItsDialogIsUpCancelsTheDialog) {
  auto agent = startAgent({"--answer", "ok", "--delay", "600"});
  auto dialog = startDialog({"--message", "Will you wait?", "--ok", "Yes"});
  ASSERT_TRUE(agent->waitForError("showing dialog")) << agent->errors();
  EXPECT_TRUE(dialog->process().isRunning()) << "the agent holds the dialog";
  agent->process().stop(SIGKILL);
  ASSERT_TRUE(dialog->waitForExit(10s)) << "the dialog must not hang on a dead agent";
  EXPECT_EQ(dialog->output(), "0\n");
  EXPECT_TRUE(service_->waitForLog("left the bus")) << service_->log();

  // The dead agent is gone: the next dialog has nobody to go to.
  const auto started = Clock::now();
  EXPECT_EQ(dialogOutput({"--message", "And now?"}), "0\n");
  EXPECT_LT(Clock::now() - started, 5s);
}

TEST_F(DialogAgentTest, TheNewestAgentAnswersAndTheOlderOneTakesOverWhenItLeaves) {
  auto older = startAgent({"--answer", "other"});
  auto newer = startAgent({"--answer", "ok", "--count", "1"});
  EXPECT_EQ(dialogOutput({"--message", "Who answers?", "--ok", "Newer", "--other", "Older"}),
            "1\n");
  ASSERT_TRUE(newer->waitForExit());
  EXPECT_EQ(dialogOutput({"--message", "And now?", "--ok", "Newer", "--other", "Older"}), "2\n");
  EXPECT_EQ(older->output(), "answered 2 (Older) to \"And now?\"\n");
  ASSERT_EQ(service_->logLines("unregistered").size(), 1u) << "the newer agent, at its count";
  EXPECT_EQ(older->process().stop(SIGTERM), 0);
  EXPECT_TRUE(eventually([&] { return service_->logLines("unregistered").size() == 2; }))
      << "SIGTERM unregisters in good order\n"
      << service_->log();
}

TEST_F(DialogAgentTest, AnAgentWhoseCallFailsIsDroppedAndItsDialogCancelled) {
  auto real = startAgent({"--answer", "ok"});
  // A peer that registers an object it does not have.
  auto impostor = connectClient(bus_);
  impostor->callDialogAgents("RegisterDialogAgent", {std::string("/nowhere")});
  EXPECT_EQ(dialogOutput({"--message", "First", "--ok", "OK"}), "0\n");
  EXPECT_TRUE(service_->waitForLog("and is dropped")) << service_->log();
  EXPECT_EQ(dialogOutput({"--message", "Second", "--ok", "OK"}), "1\n")
      << "the impostor is gone; the real agent answers";
  EXPECT_EQ(real->output(), "answered 1 (OK) to \"Second\"\n");
}

TEST_F(DialogAgentTest, SignInDialogsCarryTheAccountOverTheBus) {
  auto agent = startAgent(
      {"--answer", "ok", "--account", "alice@example.com", "--password", "s3cret", "--count", "2"});
  auto client = connectClient(bus_);
  PlistArray answer = client->callDialogAgents(
      "DisplayDialog", {PlistDictionary{{"message", "Sign in"},
                                        {"kind", DialogAgentProtocol::kSignInKind},
                                        {"okButtonString", "Sign In"},
                                        {"cancelButtonString", "Cancel"}}});
  ASSERT_EQ(answer.size(), 2u);
  EXPECT_EQ(answer[0].int64Value(), 1);
  ASSERT_TRUE(answer[1].dictionary());
  EXPECT_EQ(*answer[1]["accountName"].string(), "alice@example.com");
  EXPECT_EQ(*answer[1]["password"].string(), "s3cret");

  // A plain alert gets no credentials.
  PlistArray alert =
      client->callDialogAgents("DisplayDialog", {PlistDictionary{{"message", "Hi"}}});
  EXPECT_EQ(alert[0].int64Value(), 1);
  EXPECT_TRUE(alert[1].dictionary() && alert[1].dictionary()->empty());
  ASSERT_TRUE(agent->waitForExit());
  EXPECT_EQ(agent->output().find("s3cret"), std::string::npos) << "passwords are never printed";
}

TEST_F(DialogAgentTest, AnInteractiveAgentReadsTheChoiceAndTheCredentials) {
  const std::string input = platform_.directory() + "/typed";
  std::ofstream(input) << "maybe\nskip\n\nbob\nhunter2\n";
  Larderctl agent(platform_, bus_, "agent --count 2", input, "interactive");
  ASSERT_TRUE(agent.waitForError("registered")) << agent.errors();
  EXPECT_EQ(dialogOutput({"--message", "Quit Foo?", "--explanation", "Foo must quit.", "--ok",
                          "Quit", "--cancel", "Cancel", "--other", "Skip"}),
            "2\n")
      << "an unknown word is asked again; a button title chooses";
  auto client = connectClient(bus_);
  PlistArray answer = client->callDialogAgents(
      "DisplayDialog", {PlistDictionary{{"message", "Sign in"},
                                        {"kind", DialogAgentProtocol::kSignInKind},
                                        {"okButtonString", "Sign In"},
                                        {"cancelButtonString", "Cancel"}}});
  EXPECT_EQ(answer[0].int64Value(), 1) << "an empty line chooses OK";
  EXPECT_EQ(*answer[1]["accountName"].string(), "bob");
  EXPECT_EQ(*answer[1]["password"].string(), "hunter2");
  ASSERT_TRUE(agent.waitForExit());
  const std::string shown = agent.output();
  EXPECT_NE(shown.find("Foo must quit."), std::string::npos) << shown;
  EXPECT_NE(shown.find("[2] Skip"), std::string::npos) << shown;
  EXPECT_NE(shown.find("No such button"), std::string::npos) << shown;
  EXPECT_NE(shown.find("answered 1 (Sign In) to \"Sign in\" as bob"), std::string::npos) << shown;
  EXPECT_EQ(shown.find("hunter2"), std::string::npos);
}

TEST_F(DialogAgentTest, AtTheEndOfInputAnInteractiveAgentCancels) {
  const std::string input = platform_.directory() + "/empty";
  std::ofstream(input) << "";
  Larderctl agent(platform_, bus_, "agent --count 2", input, "silent");
  ASSERT_TRUE(agent.waitForError("registered")) << agent.errors();
  EXPECT_EQ(dialogOutput({"--message", "One", "--ok", "OK", "--cancel", "No"}), "0\n");
  EXPECT_EQ(dialogOutput({"--message", "Two", "--ok", "OK", "--cancel", "No"}), "0\n");
  ASSERT_TRUE(agent.waitForExit());
  EXPECT_NE(agent.output().find("answered 0 (No) to \"Two\""), std::string::npos) << agent.output();
}

TEST_F(DialogAgentTest, TheLiveInterfacesMatchTheCommittedDescriptions) {
  auto connection = bus_.connect();
  const std::string xml = introspect(*connection, "com.orvane.larderd", "/com/orvane/larderd");
  const std::string registry(DialogAgentProtocol::kRegistryInterfaceName);
  std::vector<std::string> committed = describeInterface(
      readFile(sourcePath("data/dbus/com.orvane.larderd.DialogAgents.xml")), registry);
  ASSERT_EQ(committed.size(), 3u);
  EXPECT_EQ(describeInterface(xml, registry), committed);
  EXPECT_NE(xml.find("com.orvane.larderd.AssetService"), std::string::npos)
      << "the request table is still there";

  auto agent = startAgent({"--answer", "ok"});
  const std::string name = agentName(*agent);
  ASSERT_FALSE(name.empty()) << agent->errors();
  const std::string agentXml = introspect(*connection, name, "/com/orvane/larderctl/DialogAgent");
  const std::string agentInterface(DialogAgentProtocol::kAgentInterfaceName);
  std::vector<std::string> committedAgent = describeInterface(
      readFile(sourcePath("data/dbus/com.orvane.larderd.VendDialogAgent.xml")), agentInterface);
  ASSERT_EQ(committedAgent.size(), 2u);
  EXPECT_EQ(describeInterface(agentXml, agentInterface), committedAgent);
}

}  // namespace
}  // namespace larder::testing
