// Class changes inside a data container: which items change and which never
// do, links an application planted, a locked device, superseded changes,
// hostile update files and containers that go away between passes.
#include "dataprotection/QRVDataProtectionChangeOperation.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "fs/QRVDictionaryAdditions.h"
#include "support/QRVContainerTest.h"

namespace fs = std::filesystem;
using Op = QRVDataProtectionChangeOperation;

namespace {

struct Outcome {
  bool needToRetry = false;
  bool failed = false;
  uint64_t code = 0;
};

class DataProtectionChangeTest : public QRVContainerTest {
 protected:
  void SetUp() override {
    container_ = create(identity("com.example.app"));
    ASSERT_NE(container_, nullptr);
  }
  void TearDown() override { QRVLog::close(); }

  std::string in(const std::string& relative) { return container_->url() + "/" + relative; }

  std::shared_ptr<Op> make(int32_t newClass, uint32_t changeType, bool retry = true) {
    return Op::initWithContainerMetadata(container_, newClass, retry, changeType, fileQueue_, env_.services);
  }
  std::string updateURL() {
    return Op::urlForProtectionOperationWithContainerIdentity(*container_->containerIdentity(), *env_.services);
  }
  // Runs `op` once through and waits for its completion.
  std::future<Outcome> watch(const std::shared_ptr<Op>& op) {
    auto promise = std::make_shared<std::promise<Outcome>>();
    op->setCompletionBlock([promise](bool needToRetry, const QRVError* error) {
      promise->set_value({needToRetry, error != nullptr, error ? error->code() : 0});
    });
    return promise->get_future();
  }
  Outcome run(const std::shared_ptr<Op>& op) {
    QRVError error;
    EXPECT_TRUE(op->writeToDiskWithError(&error)) << error.description();
    std::future<Outcome> done = watch(op);
    op->performChangeOperation();
    EXPECT_EQ(done.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    return done.get();
  }
  // The device locks as the daemon sees it: the lock state, and the
  // lock-state queue held.
  void lockDevice() {
    env_.lockState->state = 1;
    env_.services->lockStateQueue->suspend();
  }
  void unlockDevice() {
    env_.lockState->state = 0;
    env_.services->lockStateQueue->resume();
  }
  std::string capturedLog(const std::function<void()>& work) {
    const std::string path = env_.root.path() + "/dp-" + std::to_string(logCount_++) + ".log";
    EXPECT_TRUE(QRVLog::open("test", path, QRVLogLevel::kDebug, 1, 1 << 20));
    work();
    QRVLog::close();
    return QRVReadText(path);
  }

  std::shared_ptr<QRVSerialQueue> fileQueue_ = QRVSerialQueue::create("test.protection-files");
  QRVMetadataRef container_;
  int logCount_ = 0;
};

}  // namespace

TEST_F(DataProtectionChangeTest, APassSetsEveryItemButLeavesClassTwoAndNeverRaisesWithBitTwo) {
  file(in("Documents/a.txt"));
  file(in("Documents/two.txt"), 2);
  fs::create_directories(in("Documents/twodir"));
  setClass(in("Documents/twodir"), 2);
  file(in("Library/Preferences/p.plist"), 1);
  file(in("SystemData/s"), 1);
  ASSERT_EQ(mkfifo(in("tmp/fifo").c_str(), 0600), 0);
  // Deeper than the walk keeps descriptors open for.
  std::string deep = in("tmp");
  for (int i = 0; i < 40; i++) deep += "/d" + std::to_string(i);
  file(deep + "/leaf");

  Outcome o = run(make(4, Op::kChangeDirectories | Op::kChangeFiles));
  EXPECT_FALSE(o.failed);
  EXPECT_FALSE(o.needToRetry);
  EXPECT_EQ(classOf(in("Documents/a.txt")), 4u);
  EXPECT_EQ(classOf(in("Documents")), 4u);
  EXPECT_EQ(classOf(in("Library/Caches")), 4u);
  EXPECT_EQ(classOf(in("Library/Preferences/p.plist")), 4u);
  EXPECT_EQ(classOf(deep + "/leaf"), 4u);
  EXPECT_EQ(classOf(deep), 4u);
  EXPECT_EQ(classOf(in("tmp/d0")), 4u);
  EXPECT_EQ(classOf(in("Documents/two.txt")), 2u);
  EXPECT_EQ(classOf(in("Documents/twodir")), 2u);
  // Not user data, and not an item: the container itself.
  EXPECT_EQ(classOf(in("SystemData/s")), 1u);
  EXPECT_EQ(classOf(container_->url()), 0u);
  EXPECT_FALSE(fs::exists(updateURL()));

  // Bit 2: a file already in a lower class keeps it, a higher one comes down.
  file(in("Documents/low.txt"), 1);
  setClass(in("Documents/a.txt"), 4);
  o = run(make(3, Op::kChangeDirectories | Op::kChangeFiles | Op::kNeverRaiseFileClass));
  EXPECT_FALSE(o.failed);
  EXPECT_EQ(classOf(in("Documents/low.txt")), 1u);
  EXPECT_EQ(classOf(in("Documents/a.txt")), 3u);
  EXPECT_EQ(classOf(in("Documents")), 3u);
  EXPECT_EQ(classOf(in("Documents/two.txt")), 2u);

  // Files only, to "none": files go to 3, directories stay as they are.
  setClass(in("Documents/a.txt"), 1);
  o = run(make(0, Op::kChangeFiles));
  EXPECT_FALSE(o.failed);
  EXPECT_EQ(classOf(in("Documents/a.txt")), 3u);
  EXPECT_EQ(classOf(in("Documents/low.txt")), 3u);
  EXPECT_EQ(classOf(in("Documents")), 3u);
  EXPECT_EQ(classOf(in("Documents/two.txt")), 2u);
}

TEST_F(DataProtectionChangeTest, LinksPlantedByTheApplicationAreNeverFollowed) {
  QRVTemporaryDirectory outsideRoot;
  const std::string outside = outsideRoot.path() + "/secret";
  fs::create_directories(outside);
  file(outside + "/f", 1);
  setClass(outside, 1);
  fs::create_symlink(outside, in("Documents/escape"));
  fs::create_symlink(outside + "/f", in("Documents/filelink"));
  fs::create_symlink(outsideRoot.path() + "/missing", in("Documents/dangling"));
  // A whole item replaced by a link.
  fs::remove_all(in("Library"));
  fs::create_symlink(outside, in("Library"));
  file(in("Documents/mine"));

  Outcome o = run(make(4, Op::kChangeDirectories | Op::kChangeFiles));
  EXPECT_FALSE(o.failed);
  EXPECT_EQ(classOf(in("Documents/mine")), 4u);
  EXPECT_EQ(classOf(outside), 1u);
  EXPECT_EQ(classOf(outside + "/f"), 1u);
}

TEST_F(DataProtectionChangeTest, ALockedDeviceRetriesAfterUnlockAndStartsTheRetryOnce) {
  file(in("Documents/a.txt"));
  lockDevice();
  auto op = make(4, Op::kChangeDirectories | Op::kChangeFiles);
  QRVError error;
  ASSERT_TRUE(op->writeToDiskWithError(&error)) << error.description();
  std::atomic<int> retryStarts{0};
  op->setRetryStartBlock([&] { retryStarts++; });
  std::future<Outcome> done = watch(op);
  op->performChangeOperation();

  // Waiting for the unlock: nothing changed, the file stays, the daemon is
  // kept alive.
  EXPECT_EQ(done.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
  EXPECT_TRUE(fs::exists(updateURL()));
  EXPECT_EQ(classOf(in("Documents/a.txt")), 0u);
  EXPECT_EQ(env_.messages->transactions.load(), 1);
  EXPECT_EQ(retryStarts.load(), 0);

  // Unlocked, but locked again by the time the retry sets its first class:
  // the retry queues another, which does not start the retry again.
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kSetProtectionClass, EPERM);
  unlockDevice();
  ASSERT_EQ(done.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  Outcome o = done.get();
  EXPECT_FALSE(o.failed);
  EXPECT_FALSE(o.needToRetry);
  EXPECT_EQ(retryStarts.load(), 1);
  EXPECT_TRUE(op->retried());
  EXPECT_EQ(classOf(in("Documents/a.txt")), 4u);
  EXPECT_FALSE(fs::exists(updateURL()));
  env_.services->lockStateQueue->sync([] {});
  EXPECT_EQ(env_.messages->transactions.load(), 0);
}

TEST_F(DataProtectionChangeTest, ALockedDeviceWithoutRetryEndsWithSixtyOneAndDeletesTheFile) {
  file(in("Documents/a.txt"), 1);
  env_.lockState->state = 1;
  Outcome o = run(make(4, Op::kChangeDirectories | Op::kChangeFiles, /*retry=*/false));
  EXPECT_TRUE(o.failed);
  EXPECT_TRUE(o.needToRetry);
  EXPECT_EQ(o.code, QRVResultCode::kDeviceLocked);
  EXPECT_FALSE(fs::exists(updateURL()));
  env_.lockState->state = 0;
  EXPECT_EQ(classOf(in("Documents/a.txt")), 1u);
}

TEST_F(DataProtectionChangeTest, ANewerChangeSupersedesTheOlderWhichNeverDeletesIt) {
  file(in("Documents/a.txt"));
  auto older = make(4, Op::kChangeDirectories | Op::kChangeFiles);
  auto newer = make(1, Op::kChangeDirectories | Op::kChangeFiles);
  QRVError error;
  ASSERT_TRUE(older->writeToDiskWithError(&error));
  ASSERT_TRUE(newer->writeToDiskWithError(&error));
  EXPECT_FALSE(older->_stillMostCurrentUpdate());
  EXPECT_TRUE(newer->_stillMostCurrentUpdate());

  std::future<Outcome> done = watch(older);
  older->performChangeOperation();
  Outcome o = done.get();
  EXPECT_TRUE(o.failed);
  EXPECT_EQ(o.code, QRVResultCode::kSuperseded);
  EXPECT_EQ(classOf(in("Documents/a.txt")), 0u);
  ASSERT_TRUE(fs::exists(updateURL()));
  EXPECT_TRUE(newer->_stillMostCurrentUpdate());
  EXPECT_TRUE(older->_deleteUpdateFileWithError(&error));
  EXPECT_TRUE(fs::exists(updateURL()));

  done = watch(newer);
  newer->performChangeOperation();
  o = done.get();
  EXPECT_FALSE(o.failed);
  EXPECT_EQ(classOf(in("Documents/a.txt")), 1u);
  EXPECT_FALSE(fs::exists(updateURL()));
}

TEST_F(DataProtectionChangeTest, UpdateFilesReadBackAsWrittenAndBadOnesAreRefusedWithTheirLogLine) {
  auto op = make(3, 7, /*retry=*/true);
  QRVError error;
  ASSERT_TRUE(op->writeToDiskWithError(&error));
  const std::string url = updateURL();
  std::vector<uint8_t> bytes;
  ASSERT_TRUE(env_.services->fileManager->readFileAtURL(url, &bytes, &error));
  ASSERT_GE(bytes.size(), 8u);
  EXPECT_EQ(std::string(bytes.begin(), bytes.begin() + 8), "bplist00");
  auto reloaded = Op::dataProtectionChangeOperationAtURL(url, fileQueue_, env_.services, &error);
  ASSERT_NE(reloaded, nullptr) << error.description();
  EXPECT_EQ(reloaded->internalChangeID(), op->internalChangeID());
  EXPECT_EQ(reloaded->newDataProtectionClass(), 3);
  EXPECT_EQ(reloaded->changeType(), 7u);
  EXPECT_TRUE(reloaded->retryIfLocked());
  EXPECT_EQ(reloaded->dataContainerMetadata()->url(), container_->url());

  const QRVPlist good = *QRV_dictionaryWithContentsOfURL(*env_.services->fileManager, url, &error);
  auto with = [&](const char* key, std::optional<QRVPlist> value) {
    QRVPlist p = good;
    if (value) {
      p.set(key, *value);
    } else {
      p.remove(key);
    }
    return p;
  };
  // The older form of the user: a uid, taken as the personal persona.
  QRVPlist legacy = with(Op::kUserIdentityKey, std::nullopt).set(Op::kUserIdKey, QRVPlist::uinteger(501));
  ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, legacy, url, &error));
  auto update = Op::_readAndValidateDataProtectionUpdateAtURL(url, *env_.services, &error);
  ASSERT_TRUE(update.has_value()) << error.description();
  EXPECT_EQ(update->userIdentity->posixUID(), 501u);
  EXPECT_EQ(update->userIdentity->posixGID(), 501u);

  const std::string uuidText = op->internalChangeID().string();
  struct Case {
    QRVPlist file;
    std::string line;
  };
  const std::vector<Case> cases = {
      {with(Op::kContainerClassKey, QRVPlist::uinteger(0)), "Invalid update info container class: 0 at " + url},
      {with(Op::kContainerClassKey, QRVPlist::uinteger(14)), "Invalid update info container class: 14 at " + url},
      {with(Op::kIdentifierKey, QRVPlist::uinteger(5)), "Invalid update info Identifier: "},
      {with(Op::kIdentifierKey, QRVPlist::string("../../etc")), "Invalid update info Identifier: "},
      {with(Op::kUserIdentityKey, std::nullopt), "Invalid update info user identity: (null) at " + url + ": 2"},
      {with(Op::kUserIdentityKey, QRVPlist::string("mobile")), "Invalid update info user identity: "},
      {with(Op::kUserIdentityKey, std::nullopt).set(Op::kUserIdKey, QRVPlist::string("501")),
       "Invalid update info user id: "},
      {with(Op::kProtectionClassKey, QRVPlist::string("4")), "Invalid update info protection class: "},
      {with(Op::kChangeTypeKey, QRVPlist::uinteger(0)), "Invalid update info change type: "},
      {with(Op::kChangeTypeKey, std::nullopt), "Invalid update info change type: (null) at " + url},
      {with(Op::kRetryIfLockedKey, QRVPlist::string("yes")), "Invalid update info retry: "},
      {with(Op::kInternalIDKey, QRVPlist::uinteger(1)), "Invalid update info UUID String: "},
      {with(Op::kInternalIDKey, QRVPlist::string("not-a-uuid")), "Invalid update info UUID: not-a-uuid at " + url},
  };
  for (const Case& c : cases) {
    ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, c.file, url, &error));
    std::string log = capturedLog([&] {
      EXPECT_EQ(Op::dataProtectionChangeOperationAtURL(url, fileQueue_, env_.services, &error), nullptr) << c.line;
    });
    EXPECT_EQ(error.code(), QRVResultCode::kInvalidFileContent) << c.line;
    EXPECT_NE(log.find(c.line), std::string::npos) << c.line << "\n" << log;
    // An operation whose file went bad is no longer the current one.
    EXPECT_FALSE(op->_stillMostCurrentUpdate()) << c.line;
  }

  // Not a property list, cut short, or of the wrong shape: unreadable.
  ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, good, url, &error));
  ASSERT_TRUE(env_.services->fileManager->readFileAtURL(url, &bytes, &error));
  bytes.resize(bytes.size() / 2);
  ASSERT_TRUE(env_.services->fileManager->writeFileAtomically(url, bytes, 0644, &error));
  std::string log =
      capturedLog([&] { EXPECT_FALSE(Op::_readAndValidateDataProtectionUpdateAtURL(url, *env_.services, &error)); });
  EXPECT_EQ(error.code(), QRVResultCode::kFileUnreadable);
  EXPECT_NE(log.find("Failed to read update info at URL " + url), std::string::npos) << log;
  QRVWriteText(url, "");
  EXPECT_FALSE(Op::_readAndValidateDataProtectionUpdateAtURL(url, *env_.services, &error));
  EXPECT_EQ(error.code(), QRVResultCode::kFileUnreadable);
  fs::remove(url);
  fs::create_symlink(env_.root.path() + "/elsewhere.plist", url);
  ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, good, env_.root.path() + "/elsewhere.plist", &error));
  EXPECT_FALSE(Op::_readAndValidateDataProtectionUpdateAtURL(url, *env_.services, &error));
  EXPECT_EQ(error.code(), QRVResultCode::kFileUnreadable);
  EXPECT_FALSE(Op::_readAndValidateDataProtectionUpdateAtURL("", *env_.services, &error));
  EXPECT_EQ(error.code(), QRVResultCode::kInvalidInput);

  // A good file under a name that is not its container's is not ours.
  const std::string stray = fs::path(url).parent_path().string() + "/stray.plist";
  ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, good, stray, &error));
  EXPECT_EQ(Op::dataProtectionChangeOperationAtURL(stray, fileQueue_, env_.services, &error), nullptr);
  EXPECT_EQ(error.code(), QRVResultCode::kInvalidFileContent);
}

TEST_F(DataProtectionChangeTest, AContainerRemovedOrMovedBetweenPassesEndsTheChange) {
  file(in("Documents/a.txt"));
  lockDevice();
  auto op = make(4, Op::kChangeDirectories | Op::kChangeFiles);
  QRVError error;
  ASSERT_TRUE(op->writeToDiskWithError(&error));
  std::future<Outcome> done = watch(op);
  op->performChangeOperation();
  auto admin = this->admin();
  ASSERT_TRUE(admin->deleteContainerWithContainerIdentity(container_->containerIdentity(), false, &error))
      << error.description();
  uint64_t result = 0;
  admin->completeWithError(&result);
  unlockDevice();
  ASSERT_EQ(done.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  Outcome o = done.get();
  EXPECT_TRUE(o.failed);
  EXPECT_EQ(o.code, QRVResultCode::kNoSuchContainer);
  EXPECT_FALSE(fs::exists(updateURL()));

  // A container found at another path than the operation knows: 10.
  container_ = create(identity("com.example.app"));
  auto moved = Op::initWithContainerMetadata(container_->withURL(container_->url() + "-old"), 4, true, 3, fileQueue_,
                                             env_.services);
  ASSERT_TRUE(moved->writeToDiskWithError(&error));
  done = watch(moved);
  moved->performChangeOperation();
  o = done.get();
  EXPECT_EQ(o.code, QRVResultCode::kUnexpectedPath);
}
