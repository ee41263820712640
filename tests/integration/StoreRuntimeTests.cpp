// The store runtime against the reference store on loopback, in process:
// purchases, downloads and installs, sign-in, and every way a store can
// fail.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <map>
#include <tuple>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendTransactionService.h"
#include "tests/integration/InProcessRuntime.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr std::uint64_t kAccountID = 7001;
constexpr std::uint64_t kNotesItem = 501;
constexpr char kAccountName[] = "reader@example.org";
constexpr char kPassword[] = "correct horse";

// Answers every dialog with what it was given and counts them; or, when
// holding, keeps every dialog unanswered until the test cancels them all.
class ScriptedPresenter : public VendDialogPresenter {
 public:
  ScriptedPresenter(std::int64_t exitCode, PlistDictionary values, bool holding = false)
      : exitCode_(exitCode), values_(std::move(values)), holding_(holding) {}
  void present(const VendDialog& dialog, Reply reply) override {
    ++shown;
    lastKind = dialog.kind();
    if (!holding_) return reply({exitCode_, values_});
    std::lock_guard lock(mutex_);
    held_.push_back(std::move(reply));
  }
  void dismiss(std::string_view, std::int64_t) override {}
  void cancelAll() {
    std::vector<Reply> held;
    {
      std::lock_guard lock(mutex_);
      held.swap(held_);
    }
    for (Reply& reply : held) reply({VendDialogButton::kCancel, {}});
  }
  std::atomic<int> shown{0};
  std::atomic<std::int64_t> lastKind{-1};

 private:
  std::int64_t exitCode_;
  PlistDictionary values_;
  bool holding_;
  std::mutex mutex_;
  std::vector<Reply> held_;
};

class StoreRuntimeTest : public InProcessRuntimeTest {
 protected:
  void SetUp() override {
    catalogue_.addAccount(
        {.accountID = kAccountID, .orvaneID = kAccountName, .password = kPassword});
    catalogue_.addItem({.wareID = kNotesItem,
                        .bundleID = "com.example.Notes",
                        .title = "Notes",
                        .version = "2.0",
                        .payloadBytes = 3 * 1024 * 1024});
    // Small chunks, so that the package has several digests to check.
    catalogue_.setStoreSettings({}, 256 * 1024);
  }

  void startStore(const std::vector<std::string>& faults = {}, double timeout = 10) {
    InProcessRuntimeTest::startStore(faults, timeout);
    proxy_ =
        std::make_unique<VendServiceProxy>(VendStoreClient::initWithStoreClientType(0), runtime_);
  }

  void signIn() { ASSERT_TRUE(signInThrough(*proxy_, kAccountName, kPassword)); }

  struct PurchaseResult {
    std::optional<TillPurchaseResponse> response;
    bool success = false;
    OptionalError error;
  };
  PurchaseResult purchase(std::uint64_t item, std::int64_t options) {
    PurchaseResult result;
    auto purchase =
        TillPurchase::purchaseWithBuyParameters("itemId=" + std::to_string(item) + "&price=0");
    purchase.setItemIdentifier(item);
    proxy_->transactionServiceSynchronousBlock(
        [&](VendTransactionService& service, DispatchSemaphore& done) {
          service.performPurchase(purchase, {}, options,
                                  [&](const std::optional<TillPurchaseResponse>& response,
                                      bool success, const OptionalError& error) {
                                    result = {response, success, error};
                                    done.signal();
                                  });
        });
    return result;
  }

  struct DownloadResult {
    std::int64_t result = -1;
    OptionalError error;
  };
  DownloadResult install(const std::shared_ptr<TillDownload>& download) {
    DownloadResult outcome;
    proxy_->downloadServiceSynchronousBlock(
        [&](VendDownloadService& service, DispatchSemaphore& done) {
          service.performDownload(download, 0, [&](std::int64_t result, OptionalError error) {
            outcome = {result, std::move(error)};
            done.signal();
          });
        });
    return outcome;
  }

  // The purchase's one download, to be installed by the test.
  std::shared_ptr<TillDownload> purchasedDownload(std::uint64_t item = kNotesItem) {
    auto result = purchase(item, VendTransactionService::kLeaveDownloadsToCaller);
    EXPECT_TRUE(result.success) << (result.error ? result.error->descriptionText() : "");
    if (!result.response || result.response->downloads().size() != 1) return nullptr;
    auto download = result.response->downloads().front();
    download->setDownloadType(TillDownload::kInstall);
    return download;
  }

  [[nodiscard]] std::string installedBundle() const {
    return platform_.root() + "/Applications/Notes.app";
  }

  // Nothing of the bundle under Applications, nothing left among downloads.
  void expectNothingInstalledOrHalfWritten() const {
    EXPECT_FALSE(fs::exists(installedBundle()));
    std::size_t applications = 0;
    for ([[maybe_unused]] const auto& entry :
         fs::directory_iterator(platform_.root() + "/Applications")) {
      ++applications;
    }
    EXPECT_EQ(applications, 0U) << "staging left beside the applications";
    const std::string downloads = runtime_->configuration().downloadsDirectory;
    if (!fs::exists(downloads)) return;
    for (const auto& entry : fs::recursive_directory_iterator(downloads)) {
      EXPECT_FALSE(entry.is_regular_file()) << "left behind: " << entry.path();
    }
  }

  std::unique_ptr<VendServiceProxy> proxy_;
};

TEST_F(StoreRuntimeTest, PurchaseDownloadsChecksAndInstallsTheBundle) {
  startStore();
  signIn();
  auto download = purchasedDownload();
  ASSERT_TRUE(download);
  EXPECT_EQ(download->metadata().bundleIdentifier(), "com.example.Notes");
  auto outcome = install(download);
  ASSERT_EQ(outcome.result, 1) << (outcome.error ? outcome.error->descriptionText() : "");
  EXPECT_TRUE(fs::exists(installedBundle() + "/bundle.plist"));
  EXPECT_TRUE(fs::exists(installedBundle() + "/purchase.plist"));
  EXPECT_EQ(store_->requestCount("buy-product"), 1U);
}

// Every path below `folder`, with a hash of the contents of its files.
std::map<std::string, std::size_t> filesBelow(const std::string& folder) {
  std::map<std::string, std::size_t> files;
  for (const auto& entry : fs::recursive_directory_iterator(folder)) {
    const auto bytes = FileIO::read(entry.path().string());
    files[fs::relative(entry.path(), folder).string()] =
        bytes ? std::hash<std::string>{}(std::string(bytes->begin(), bytes->end())) : 0;
  }
  return files;
}

// The store names the bundle to replace by the identifier it sends, and
// sends the bundle too: neither may take over anything but store software
// of the identifier bought.
TEST_F(StoreRuntimeTest, AnInstallReplacesOnlyStoreSoftwareWithTheBundleBought) {
  const std::string applications = platform_.root() + "/Applications";
  platform_.installBundle({applications, "Other", "com.example.Other"});
  platform_.installBundle({applications, "Notes", "com.example.Notes", "1.0", kNotesItem});
  catalogue_.addItem({.wareID = 502, .bundleID = "com.example.Other", .title = "Other"});
  const std::string nameless = catalogue_.makeBundle("Nameless", "", "1.0", 503, 4096);
  EXPECT_TRUE(FileIO::writeAtomically(
      nameless + "/bundle.plist",
      PropertyListSerialization::writeXml(PlistDictionary{{"HostBundleExecutable", "Nameless"}})));
  catalogue_.addItem({.wareID = 503,
                      .bundleID = "com.example.Nameless",
                      .title = "Nameless",
                      .bundlePath = nameless});
  catalogue_.addItem(
      {.wareID = 504,
       .bundleID = "com.example.Notes",
       .title = "Impostor",
       .bundlePath = catalogue_.makeBundle("Impostor", "com.example.Impostor", "9.0", 504, 4096)});
  const auto before = filesBelow(applications);
  startStore();
  signIn();
  const std::vector<std::pair<std::uint64_t, std::string>> refusals = {
      {502, "is not store software"}, {503, "has no identifier"}, {504, "com.example.Impostor"}};
  for (const auto& [item, phrase] : refusals) {
    SCOPED_TRACE(item);
    auto download = purchasedDownload(item);
    ASSERT_TRUE(download);
    auto outcome = install(download);
    const std::string why = outcome.error ? outcome.error->description : "";
    EXPECT_EQ(outcome.result, 0);
    EXPECT_NE(why.find(phrase), std::string::npos) << why;
  }
  EXPECT_EQ(filesBelow(applications), before);
}

// The store sends a bundle whose links, each harmless by its name, chain out
// of it: eight folders deep a link climbs back to the bundle, a second walks
// through it one level further, a third reads a system file through that.
TEST_F(StoreRuntimeTest, APackageWhoseLinksChainOutOfTheBundleIsNotInstalled) {
  const std::string bundle = catalogue_.makeBundle("Notes", "com.example.Notes", "3.0", 505, 4096);
  const fs::path deep = fs::path(bundle) / "a/b/c/d/e/f/g/h";
  fs::create_directories(deep);
  std::string eightUp;
  for (int level = 0; level < 8; ++level) eightUp += "../";
  fs::create_directory_symlink(eightUp, deep / "up");
  fs::create_directory_symlink("a/b/c/d/e/f/g/h/up/" + eightUp + "..", fs::path(bundle) / "out");
  fs::create_symlink("out/etc/passwd", fs::path(bundle) / "passwd");
  catalogue_.addItem(
      {.wareID = 505, .bundleID = "com.example.Notes", .title = "Notes", .bundlePath = bundle});
  startStore();
  signIn();
  auto download = purchasedDownload(505);
  ASSERT_TRUE(download);
  auto outcome = install(download);
  EXPECT_EQ(outcome.result, 0);
  ASSERT_TRUE(outcome.error);
  EXPECT_NE(outcome.error->description.find("link"), std::string::npos)
      << outcome.error->description;
  expectNothingInstalledOrHalfWritten();
}

TEST_F(StoreRuntimeTest, PurchaseWithoutOptionsStartsTheInstallItself) {
  startStore();
  signIn();
  auto result = purchase(kNotesItem, 0);
  ASSERT_TRUE(result.success) << (result.error ? result.error->descriptionText() : "");
  EXPECT_TRUE(eventually([&] { return fs::exists(installedBundle() + "/bundle.plist"); }, 20s));
}

// Every way a store can break a purchase: where it stops, how it says so,
// what reached the store; never anything installed, never a hang.
struct BrokenStore {
  const char* name;
  std::vector<std::string> faults;
  enum Stage { kBag, kPurchase, kInstall } failsAt;
  double timeout = 10;
  std::optional<std::int64_t> code;
  std::string phrase;  // in the error's description
  std::optional<std::uint64_t> buyRequests;
  std::optional<std::uint64_t> signedBuyRequests;
};

void PrintTo(const BrokenStore& broken, std::ostream* out) {
  *out << broken.name;
}

class BrokenStoreTest : public StoreRuntimeTest,
                        public ::testing::WithParamInterface<BrokenStore> {};

TEST_P(BrokenStoreTest, EndsInAClearErrorWithNothingInstalled) {
  const BrokenStore& broken = GetParam();
  startStore(broken.faults, broken.timeout);
  OptionalError error;
  const auto started = std::chrono::steady_clock::now();
  if (broken.failsAt == BrokenStore::kBag) {
    const auto load = runtime_->urlBag().load(0);
    EXPECT_FALSE(load.success);
    ASSERT_TRUE(load.error);
    EXPECT_FALSE(load.error->description.empty());
    EXPECT_FALSE(runtime_->urlBag().urlForKey(0, "buy-product", &error));
    EXPECT_TRUE(error);
    EXPECT_FALSE(purchase(kNotesItem, 0).success);
  } else if (broken.failsAt == BrokenStore::kPurchase) {
    signIn();
    // Left to itself, a purchase would go on to download what it was sent.
    auto result = purchase(kNotesItem, 0);
    EXPECT_FALSE(result.success);
    EXPECT_FALSE(result.response);
    error = result.error;
    EXPECT_EQ(requests("assets"), 0U);
  } else {
    signIn();
    auto download = purchasedDownload();
    ASSERT_TRUE(download);
    auto outcome = install(download);
    EXPECT_EQ(outcome.result, 0);
    error = outcome.error;
  }
  EXPECT_LT(std::chrono::steady_clock::now() - started, 15s);
  ASSERT_TRUE(error);
  EXPECT_FALSE(error->description.empty());
  if (broken.code) {
    EXPECT_EQ(error->code, *broken.code) << error->descriptionText();
  }
  EXPECT_NE(error->descriptionText().find(broken.phrase), std::string::npos)
      << error->descriptionText();
  if (broken.buyRequests) {
    EXPECT_EQ(requests("buy-product"), *broken.buyRequests);
  }
  if (broken.signedBuyRequests) {
    EXPECT_EQ(store_->signedRequestCount("buy-product"), *broken.signedBuyRequests);
  }
  expectNothingInstalledOrHalfWritten();
}

INSTANTIATE_TEST_SUITE_P(
    , BrokenStoreTest,
    ::testing::Values(
        BrokenStore{"BagNotAPropertyList", {"bag=not-plist"}, BrokenStore::kBag, 10, {}, "", 0},
        BrokenStore{"BagOfTheWrongShape", {"bag=wrong-shape"}, BrokenStore::kBag, 10, {}, "", 0},
        BrokenStore{"BagServerError", {"bag=500"}, BrokenStore::kBag, 10, {}, "", 0},
        BrokenStore{"PurchaseNotAPropertyList", {"buy-product=not-plist"}, BrokenStore::kPurchase},
        BrokenStore{"PurchaseOfTheWrongShape", {"buy-product=wrong-shape"}, BrokenStore::kPurchase},
        BrokenStore{"PurchaseServerError", {"buy-product=500"}, BrokenStore::kPurchase},
        BrokenStore{"PurchaseAnswerForAnotherItem",
                    {"buy-product=other-item"},
                    BrokenStore::kPurchase,
                    10,
                    VendStoreAnswer::kWrongItem,
                    "not the item bought (501)",
                    1},
        // The store sends the signed purchase from 127.0.0.1 to localhost:
        // the request arrives there without the account and its signature
        // (and so is refused as unsigned).
        BrokenStore{"CrossHostRedirectLeavesTheAccountHeadersBehind",
                    {"buy-product=redirect-host"},
                    BrokenStore::kPurchase,
                    10,
                    401,
                    "",
                    2,
                    1},
        BrokenStore{"StoreThatDoesNotAnswer",
                    {"assets=stall", "buy-product=stall"},
                    BrokenStore::kPurchase,
                    2},
        BrokenStore{"CorruptAsset", {"assets=corrupt"}, BrokenStore::kInstall},
        BrokenStore{"TruncatedAsset", {"assets=truncate"}, BrokenStore::kInstall},
        BrokenStore{"AssetServerError", {"assets=500"}, BrokenStore::kInstall},
        BrokenStore{"StalledAsset", {"assets=stall"}, BrokenStore::kInstall, 2}),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(StoreRuntimeTest, ConcurrentCallersShareOneBagFetchObserversHearOfItAndAMissingKeyIs30) {
  startStore();
  class CountingObserver : public VendURLBagObserver {
   public:
    void urlBagDidUpdateWithSuccess(bool success, const OptionalError&) override {
      if (success) ++loads;
    }
    std::atomic<int> loads{0};
  };
  auto observer = std::make_shared<CountingObserver>();
  runtime_->urlBag().addObserver(0, observer);
  std::vector<std::thread> callers;
  for (int i = 0; i < 10; ++i) {
    callers.emplace_back(
        [&] { EXPECT_TRUE(runtime_->urlBag().valueForKey(0, "buy-product").isString()); });
  }
  for (auto& caller : callers) caller.join();
  EXPECT_EQ(store_->requestCount("bag"), 1U);
  EXPECT_EQ(observer->loads, 1);
  EXPECT_TRUE(runtime_->urlBag().load(0, true).loaded);
  EXPECT_EQ(store_->requestCount("bag"), 2U);
  EXPECT_EQ(observer->loads, 2);
  // A fetch of another bag type is not this observer's.
  EXPECT_TRUE(runtime_->urlBag().load(1, true).success);
  EXPECT_EQ(store_->requestCount("bag"), 3U);
  EXPECT_EQ(observer->loads, 2);

  OptionalError error;
  EXPECT_FALSE(runtime_->urlBag().urlForKey(0, "no-such-request", &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, 30) << "a missing key";
}

TEST_F(StoreRuntimeTest, APurchaseWithoutAccountAsksTheUserAndRemembersTheAccount) {
  startStore();
  auto presenter = std::make_shared<ScriptedPresenter>(
      VendDialogButton::kOK,
      PlistDictionary{{"accountName", kAccountName}, {"password", kPassword}});
  runtime_->setDialogPresenter(presenter);
  auto result = purchase(kNotesItem, VendTransactionService::kLeaveDownloadsToCaller);
  ASSERT_TRUE(result.success) << (result.error ? result.error->descriptionText() : "");
  EXPECT_EQ(presenter->shown, 1);
  EXPECT_EQ(presenter->lastKind, VendDialog::kSignIn);
  auto primary = runtime_->accountStore().primaryAccount();
  ASSERT_TRUE(primary);
  EXPECT_EQ(primary->accountID, kAccountID);
  // The account and its key survive in a file only the user can read.
  struct stat info {};
  ASSERT_EQ(::stat(runtime_->accountStore().path().c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 077, 0U);
  VendAccountStore reloaded(runtime_->configuration());
  ASSERT_TRUE(reloaded.primaryAccount());
  EXPECT_EQ(reloaded.primaryAccount()->signingKey, primary->signingKey);
  // The next purchase asks nobody.
  EXPECT_TRUE(purchase(kNotesItem, VendTransactionService::kLeaveDownloadsToCaller).success);
  EXPECT_EQ(presenter->shown, 1);
}

TEST_F(StoreRuntimeTest, ASignInThatDoesNotSucceedFailsThePurchase) {
  startStore();
  const std::vector<std::tuple<const char*, std::shared_ptr<VendDialogPresenter>, std::int64_t>>
      cases{
          {"no dialog agent", nullptr, VendError::kCancelledCode},
          {"cancelled",
           std::make_shared<ScriptedPresenter>(VendDialogButton::kCancel, PlistDictionary{}),
           VendError::kCancelledCode},
          {"wrong password",
           std::make_shared<ScriptedPresenter>(
               VendDialogButton::kOK,
               PlistDictionary{{"accountName", kAccountName}, {"password", "wrong"}}),
           401},
      };
  for (const auto& [what, presenter, code] : cases) {
    SCOPED_TRACE(what);
    if (presenter) runtime_->setDialogPresenter(presenter);
    auto result = purchase(kNotesItem, VendTransactionService::kLeaveDownloadsToCaller);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->code, code);
    EXPECT_FALSE(runtime_->accountStore().primaryAccount());
  }
  EXPECT_EQ(requests("buy-product"), 0U);
}

TEST_F(StoreRuntimeTest, SignaturesRoundTripAndAForgedAnswerIsRefused) {
  startStore();
  signIn();
  std::optional<VendURLRequest> signedRequest;
  proxy_->transactionServiceSynchronousBlock([&](VendTransactionService& service,
                                                 DispatchSemaphore& done) {
    service.signURLRequest(VendURLRequest(store_->baseURL() + "/x"), "daap", std::nullopt,
                           [&](const std::optional<VendURLRequest>& request, const OptionalError&) {
                             signedRequest = request;
                             done.signal();
                           });
  });
  ASSERT_TRUE(signedRequest);
  EXPECT_TRUE(signedRequest->valueForHeaderField("X-Larder-Signature").has_value());

  const auto account = runtime_->accountStore().primaryAccount();
  ASSERT_TRUE(account);
  const PlistData body{'o', 'k'};
  VendURLResponse response;
  response.statusCode = 200;
  response.headers.emplace_back("x-larder-signature",
                                VendRequestSigner(account->signingKey).answerSignature(200, body));
  auto verify = [&](const VendURLResponse& answer) {
    std::optional<PlistData> verified;
    proxy_->transactionServiceSynchronousBlock(
        [&](VendTransactionService& service, DispatchSemaphore& done) {
          service.signedBodyWithURLResponse(
              answer, "daap", body, std::nullopt,
              [&](const std::optional<PlistData>& result, const OptionalError&) {
                verified = result;
                done.signal();
              });
        });
    return verified;
  };
  EXPECT_EQ(verify(response), body);
  response.statusCode = 201;  // the status is signed too
  EXPECT_FALSE(verify(response));
}

TEST_F(StoreRuntimeTest, ItemLookupFindsTheItemByIdentifierAndByBundle) {
  startStore();
  auto lookup = [&](PlistDictionary request) {
    PlistDictionary answer;
    proxy_->transactionServiceSynchronousBlock(
        [&](VendTransactionService& service, DispatchSemaphore& done) {
          service.itemLookup(std::move(request),
                             [&](bool, const PlistDictionary& result, const OptionalError&) {
                               answer = result;
                               done.signal();
                             });
        });
    return PlistValue(answer);
  };
  auto byID = lookup(
      {{"id", std::to_string(kNotesItem)}, {"caller", "com.orvane.larderd"}, {"p", "lockup"}});
  EXPECT_EQ(*byID["results"][std::to_string(kNotesItem)]["bundleId"].string(), "com.example.Notes");
  auto byBundle = lookup({{"bundleId", "com.example.Notes"}, {"p", "lockup"}});
  ASSERT_TRUE(byBundle["results"].dictionary());
  EXPECT_EQ(byBundle["results"].dictionary()->size(), 1U);
}

// More purchases than any fixed pool of workers, each waiting for a sign-in
// that is itself a service call: all of them end, and the account service
// still answers at once. Once with no dialog agent (every sign-in is
// cancelled at once), once with dialogs nobody answers until the end.
TEST_F(StoreRuntimeTest, PurchasesWaitingForSignInNeverStarveOtherServiceCalls) {
  constexpr int kPurchases = 20;
  for (const bool holdDialogs : {false, true}) {
    SCOPED_TRACE(holdDialogs ? "dialogs held" : "no dialog agent");
    startStore({"bag=slow"});
    auto holding =
        std::make_shared<ScriptedPresenter>(VendDialogButton::kCancel, PlistDictionary{}, true);
    if (holdDialogs) runtime_->setDialogPresenter(holding);
    // Shared with the replies, which may outlive a failed assertion.
    struct Tally {
      std::mutex mutex;
      std::condition_variable changed;
      int ended = 0;
      int cancelled = 0;
    };
    auto tally = std::make_shared<Tally>();
    auto transactions = proxy_->transactionService();
    for (int index = 0; index < kPurchases; ++index) {
      auto purchase = TillPurchase::purchaseWithBuyParameters("itemId=501&price=0");
      transactions->performPurchase(
          purchase, {}, VendTransactionService::kLeaveDownloadsToCaller,
          [tally](const std::optional<TillPurchaseResponse>&, bool, const OptionalError& error) {
            std::lock_guard lock(tally->mutex);
            ++tally->ended;
            if (error && error->code == VendError::kCancelledCode) ++tally->cancelled;
            tally->changed.notify_all();
          });
    }
    const auto answersWithin = [&](std::chrono::milliseconds limit) {
      auto answered = std::make_shared<DispatchSemaphore>();
      proxy_->accountService()->primaryAccount(
          [answered](std::optional<VendAccount>) { answered->signal(); });
      return answered->waitFor(limit);
    };
    if (holdDialogs) {
      eventually([&] { return holding->shown >= kPurchases; }, 30s);
      ASSERT_EQ(holding->shown, kPurchases);
      EXPECT_TRUE(answersWithin(1s)) << "a held dialog held up the account service";
      holding->cancelAll();
    }
    {
      std::unique_lock lock(tally->mutex);
      ASSERT_TRUE(tally->changed.wait_for(lock, 30s, [&] { return tally->ended == kPurchases; }))
          << tally->ended << " of " << kPurchases << " purchases ended";
      EXPECT_EQ(tally->cancelled, kPurchases);
    }
    EXPECT_TRUE(answersWithin(1s));
  }
}

TEST_F(StoreRuntimeTest, ASignInAnswerThatCarriesDownloadsInstallsNothing) {
  startStore({"authenticate=with-downloads"});
  const LogLines log;
  signIn();
  // A purchase through the same service after the sign-in has ended: by
  // then a download the sign-in had started would be under way.
  ASSERT_TRUE(purchase(kNotesItem, VendTransactionService::kLeaveDownloadsToCaller).success);
  std::size_t downloads = 99;
  proxy_->downloadServiceSynchronousBlock(
      [&](VendDownloadService& service, DispatchSemaphore& done) {
        service.downloadsWithTypeMask(-1, [&](const auto& list) {
          downloads = list.size();
          done.signal();
        });
      });
  EXPECT_EQ(downloads, 0U);
  EXPECT_EQ(store_->requestCount("assets"), 0U);
  EXPECT_FALSE(fs::exists(installedBundle()));
  EXPECT_EQ(log.at(1, "sign-in answer carries 1 download(s); they are ignored", false).size(), 1U);
}

TEST_F(StoreRuntimeTest, ATricklingTransferEndsWithinItsTimeBound) {
  catalogue_.addItem({.wareID = 502,
                      .bundleID = "com.example.Small",
                      .title = "Small",
                      .version = "1.0",
                      .payloadBytes = 16 * 1024});
  startStore({"assets=trickle"});
  signIn();
  auto bought = purchase(502, VendTransactionService::kLeaveDownloadsToCaller);
  ASSERT_TRUE(bought.response && !bought.response->downloads().empty());
  const auto assets = bought.response->downloads().front()->assets();
  ASSERT_FALSE(assets.empty());
  VendURLRequest request = assets.front().URLRequest();
  // The trickle never stalls for two seconds (a shorter stall limit is
  // within the reach of the transport's own speed sampling).
  request.setTimeoutInterval(2);
  const auto size = static_cast<std::uint64_t>(assets.front().fileSize());
  const auto bound = VendHTTPTransfer::totalTimeBound(2, size);
  ASSERT_LT(bound, 6s);
  const auto started = std::chrono::steady_clock::now();
  const auto result = VendHTTPTransfer::perform(request);
  const auto took = std::chrono::steady_clock::now() - started;
  ASSERT_TRUE(result.error);
  EXPECT_EQ(result.error->domain, VendHTTPTransfer::kErrorDomain);
  EXPECT_EQ(result.error->code, 28) << result.error->descriptionText();  // timed out
  EXPECT_GE(took, bound);
  EXPECT_LT(took, bound + 2s);
}

}  // namespace
}  // namespace larder::testing
