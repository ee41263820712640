// The deferred-install agent as its timer runs it: larderctl later-agent
// --once, with the clock given by --now. Against larderd, whose log shows
// the request arrive; and against a stand-in of the service that records
// the arguments of the two requests exactly as they come over the bus.
#include <gtest/gtest.h>

#include <ctime>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>

#include "client/ServiceRequests.h"
#include "platform/system/Mutex.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/records/RecordDateText.h"
#include "tests/integration/StoreAndService.h"
#include "tests/unit/FakeSystemServices.h"

namespace larder::testing {
namespace {

// Owns the service's name and answers the requests the agent needs, each
// recorded as "<member> <arguments...>".
class RecordingLaterService {
 public:
  explicit RecordingLaterService(const PrivateBus& bus) : connection_(bus.connect()) {
    connection_->requestName("com.orvane.larderd");
    object_ = sdbus::createObject(*connection_, std::string(ServiceRequests::kObjectPath));
    const std::string interface(ServiceRequests::kInterfaceName);
    object_->registerMethod(interface, "SetStoreClient", "a{sv}", "",
                            [](sdbus::MethodCall call) { call.createReply().send(); });
    object_->registerMethod(interface, "StartService", "", "",
                            [](sdbus::MethodCall call) { call.createReply().send(); });
    object_->registerMethod(
        interface, "NowIsLaterWithModeCountdownDeferred", "xb", "", [this](sdbus::MethodCall call) {
          std::int64_t mode = 0;
          bool deferred = false;
          call >> mode >> deferred;
          record("NowIsLater " + std::to_string(mode) + (deferred ? " true" : " false"));
          call.createReply().send();
        });
    object_->registerMethod(
        interface, "LaterDidNotOccurWithDueToACPower", "b", "", [this](sdbus::MethodCall call) {
          bool dueToACPower = false;
          call >> dueToACPower;
          record(std::string("LaterDidNotOccur ") + (dueToACPower ? "true" : "false"));
          call.createReply().send();
        });
    object_->finishRegistration();
    connection_->enterEventLoopAsync();
  }
  ~RecordingLaterService() { connection_->leaveEventLoop(); }

  // Once larderctl has ended, all of its calls are here.
  std::vector<std::string> calls() const { return calls_.calls(); }

 private:
  void record(std::string call) { calls_.add(std::move(call)); }

  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  CallRecord calls_;
};

class LaterAgentTest : public StoreAndServiceTest {
 protected:
  void arm(std::int64_t mode, std::string_view armedAt) {
    const PlistDate date = *RecordDateText::parse(armedAt);
    ASSERT_TRUE(twilight().updateDictionary([&](PlistDictionary& state) {
      state["armed"] = true;
      state["armedMode"] = mode;
      state["armedDate"] = date;
    }));
  }
  [[nodiscard]] PlatformStateFile twilight() const {
    return PlatformStateFile(platform_.root() + "/var/lib/larder-platform/twilight.plist");
  }
  // A laptop: a battery, and a mains supply plugged in or not.
  void power(bool mainsOnline) {
    const std::string supplies = platform_.root() + "/sys/class/power_supply";
    std::filesystem::create_directories(supplies + "/AC");
    std::filesystem::create_directories(supplies + "/BAT0");
    std::ofstream(supplies + "/AC/type") << "Mains\n";
    std::ofstream(supplies + "/AC/online") << (mainsOnline ? "1\n" : "0\n");
    std::ofstream(supplies + "/BAT0/type") << "Battery\n";
  }
  LarderctlRun agent(const std::string& now) {
    return run({"later-agent", "--once", "--now", now}, {{"TZ", "UTC"}});
  }
};

// End to end: the user puts a restart-required OS update off by an hour;
// when the agent's clock has passed the hour, larderd runs the Do It Later,
// the countdown runs out, and the framework holds the install for the
// logout that the recorded restart request stands for.
TEST_F(LaterAgentTest, InAnHourTheAgentBringsTheRestartIntoTheInstall) {
  const std::string framework = platform_.root() + "/var/lib/larder-platform";
  std::filesystem::create_directories(framework);
  ASSERT_TRUE(PlatformStateFile(framework + "/system-updates.plist")
                  .updateDictionary([](PlistDictionary& state) {
                    state["catalog"] =
                        PlistArray{PlistDictionary{{"productKey", "KERNEL-9"},
                                                   {"isRecommended", true},
                                                   {"restartRequired", true},
                                                   {"allowedToUseInstallLater", true}}};
                  }));
  power(true);
  startService(kNoStoreURL);
  ASSERT_EQ(run({"os-updates", "--scan"}).status, 0);
  const LarderctlRun later = run({"later", "hour"});
  ASSERT_EQ(later.status, 0) << later.errors;
  EXPECT_NE(later.output.find("os  KERNEL-9"), std::string::npos) << later.output;
  EXPECT_EQ(PlistValue(twilight().readDictionary())["armedMode"].int64Value(), 2);

  const auto inAnHour = [](int extraSeconds) {
    const std::time_t moment = std::time(nullptr) + 3600 + extraSeconds;
    char text[32];
    std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", std::gmtime(&moment));
    return std::string(text);
  };
  EXPECT_EQ(agent(inAnHour(-120)).output, "mode 2: wait\n");
  const LarderctlRun due = agent(inAnHour(60));
  ASSERT_EQ(due.status, 0) << due.errors;
  EXPECT_EQ(due.output, "mode 2: fire\n");
  EXPECT_EQ(PlistValue(twilight().readDictionary())["laterOutcome"], PlistValue("fired"));

  const PlatformStateFile requests(framework + "/restart-requests.plist");
  ASSERT_TRUE(eventually(
      [&] {
        const PlistValue recorded = requests.read();
        return recorded.array() && !recorded.array()->empty();
      },
      std::chrono::seconds(30)))
      << service_->log();
  const PlistValue request = (*requests.read().array())[0];
  EXPECT_EQ(request["kind"], PlistValue("restart"));
  EXPECT_EQ(request["productKeys"], PlistValue(PlistArray{"KERNEL-9"}));
  const PlistValue postLogout = PlistValue(PlatformStateFile(framework + "/system-updates.plist")
                                               .readDictionary())["postLogout"]["KERNEL-9"];
  EXPECT_TRUE(postLogout["restartingNow"].boolValue());
  EXPECT_TRUE(postLogout["nowIsLater"].boolValue());
  EXPECT_EQ(PlistValue(twilight().readDictionary())["countdownCount"].int64Value(), 1);

  EXPECT_EQ(agent(inAnHour(600)).output, "mode 2: nothing\n") << "never twice for one arming";
}

TEST_F(LaterAgentTest, TonightOnBatteryPassesUnusedAndOnMainsFires) {
  RecordingLaterService service(bus_);
  power(false);
  arm(1, "2026-01-01T14:00:00Z");
  EXPECT_EQ(agent("2026-01-01T23:00:00Z").output, "mode 1: wait\n");
  EXPECT_EQ(agent("2026-01-02T03:00:00Z").output, "mode 1: wait-for-power\n");
  EXPECT_TRUE(service.calls().empty());
  const LarderctlRun missed = agent("2026-01-02T05:10:00Z");
  ASSERT_EQ(missed.status, 0) << missed.errors;
  EXPECT_EQ(missed.output, "mode 1: missed (on battery)\n");
  EXPECT_EQ(service.calls(), std::vector<std::string>{"LaterDidNotOccur true"});

  power(true);
  arm(1, "2026-01-02T14:00:00Z");
  const LarderctlRun fired =
      run({"--json", "later-agent", "--once", "--now", "2026-01-03T02:30:00Z"}, {{"TZ", "UTC"}});
  ASSERT_EQ(fired.status, 0) << fired.errors;
  EXPECT_EQ(nlohmann::json::parse(fired.output),
            nlohmann::json::parse(R"({"action": "fire", "armed": true, "mode": 1})"));
  EXPECT_EQ(agent("2026-01-03T02:35:00Z").output, "mode 1: nothing\n");
  EXPECT_EQ(service.calls(),
            (std::vector<std::string>{"LaterDidNotOccur true", "NowIsLater 1 true"}));
}

TEST_F(LaterAgentTest, NotArmedOrAWrongDate) {
  const LarderctlRun idle = agent("2026-01-01T10:00:00Z");
  EXPECT_EQ(idle.status, 0) << idle.errors;
  EXPECT_EQ(idle.output, "not armed\n");
  const LarderctlRun wrong = agent("tomorrow");
  EXPECT_EQ(wrong.status, 2);
  EXPECT_NE(wrong.errors.find("--now takes an ISO 8601 date"), std::string::npos) << wrong.errors;
}

}  // namespace
}  // namespace larder::testing
