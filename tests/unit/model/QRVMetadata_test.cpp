#include "model/QRVMetadata.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;

std::vector<uint8_t> fileBytes(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::vector<uint8_t>(std::istreambuf_iterator<char>(in), {});
}

void writeBytes(const std::string& path, const std::vector<uint8_t>& bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
}

std::vector<std::string> namesIn(const std::string& directory) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(directory, ec)) names.push_back(entry.path().filename().string());
  return names;
}

class MetadataTest : public testing::Test {
 protected:
  MetadataTest() {
    alice_ = env_.services->userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501);
    bob_ = QRVUserIdentity::make(502, 502, env_.root.path() + "/home/bob", "", QRVPersonaTypePersonal, 1002);
  }

  QRVFileManager& fm() { return *env_.services->fileManager; }
  QRVGlobalConfiguration& config() { return *env_.services->globalConfiguration; }
  QRVUserIdentityCache& identities() { return *env_.services->userIdentityCache; }

  // A new, empty container directory of `c` for `u`.
  std::string containerDirectory(const QRVUserIdentityRef& u, QRVContainerClass c, const QRVUUID& uuid,
                                 bool transient = false) {
    std::string dir = *config().containerDirectoryURLForUserIdentity(u, c, transient) + "/" + uuid.string();
    fs::create_directories(dir);
    return dir;
  }
  static QRVConcreteContainerIdentityRef identity(const QRVUUID& uuid, const QRVUserIdentityRef& u,
                                                  const std::string& identifier, QRVContainerClass c) {
    return QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, u, identifier, c, nullptr);
  }
  bool write(const QRVConcreteContainerIdentityRef& id, const std::string& dir, QRVError* error,
             QRVPlist info = QRVPlist(), const std::string& assets = "") {
    return QRVMetadata::make(*id, std::move(info), dir, assets)->writeMetadataToDisk(fm(), config(), error);
  }

  // The dictionary a correct file of that container holds.
  static QRVPlist validPlist(const std::string& identifier, const QRVUUID& uuid, QRVContainerClass c,
                             const QRVUserIdentityRef& u) {
    QRVPlist d = QRVPlist::dictionary();
    d.set(QRVMetadata::kIdentifierKey, QRVPlist::string(identifier));
    d.set(QRVMetadata::kUUIDKey, QRVPlist::string(uuid.string()));
    d.set(QRVMetadata::kContentClassKey, QRVPlist::uinteger(c));
    d.set(QRVMetadata::kVersionKey, QRVPlist::string("2"));
    if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(c)) d.set(QRVMetadata::kUserIdentityKey, u->plist());
    return d;
  }
  static void writePlist(const std::string& dir, const QRVPlist& d) {
    writeBytes(dir + "/" + QRVMetadata::kFileName, d.toBinary());
  }
  static std::optional<QRVPlist> storedPlist(const std::string& dir) {
    std::vector<uint8_t> bytes = fileBytes(dir + "/" + QRVMetadata::kFileName);
    return QRVPlist::fromBytes(bytes.data(), bytes.size());
  }

  QRVMetadataRef read(const std::string& dir, const QRVUserIdentityRef& expected, bool checkClassPath,
                      QRVError* error) {
    return QRVMetadata::readAndValidateMetadataAtUrl(dir, expected, checkClassPath, fm(), identities(), error);
  }
  // The code reading fails with; 0 when it succeeds.
  uint64_t readCode(const std::string& dir, const QRVUserIdentityRef& expected, bool checkClassPath = true) {
    QRVError error;
    return read(dir, expected, checkClassPath, &error) ? 0 : error.code();
  }

  QRVTestServices env_;
  QRVUserIdentityRef alice_;
  QRVUserIdentityRef bob_;
};

// ---- Writing ----

TEST_F(MetadataTest, WriteThenReadRoundTripsEveryField) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  auto id = identity(uuid, alice_, "com.example.app", QRVContainerClassAppData);
  QRVPlist info = QRVPlist::dictionary().set("com.kelva.Verdane.ContentProtectionClass", QRVPlist::uinteger(3));
  QRVError error;
  ASSERT_TRUE(write(id, dir, &error, info, "Assets")) << error.description();

  const std::string file = dir + "/" + QRVMetadata::kFileName;
  std::vector<uint8_t> bytes = fileBytes(file);
  EXPECT_EQ(std::string(bytes.begin(), bytes.begin() + std::min<size_t>(8, bytes.size())), "bplist00");
  auto stored = storedPlist(dir);
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->stringForKey(QRVMetadata::kVersionKey), "2");
  EXPECT_EQ(stored->get(QRVMetadata::kPersonaKey), nullptr);  // never written
  struct stat st;
  ASSERT_EQ(lstat(file.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  // No data-protection class: the file must stay readable while locked.
  uint32_t protectionClass = 99;
  ASSERT_TRUE(fm().dataProtectionClassOfItemAtURL(file, &protectionClass, nullptr));
  EXPECT_EQ(protectionClass, 0u);

  auto back = read(dir, alice_, true, &error);
  ASSERT_NE(back, nullptr) << error.description();
  EXPECT_TRUE(back->containerIdentity()->isEqual(*id));
  EXPECT_EQ(back->url(), dir);
  EXPECT_EQ(back->info(), info);
  EXPECT_EQ(back->userManagedAssetsDirName(), "Assets");

  // Bundles carry no user identity.
  QRVUUID bundleUUID = QRVUUID::random();
  std::string bundle = containerDirectory(alice_, QRVContainerClassAppBundle, bundleUUID);
  ASSERT_TRUE(write(identity(bundleUUID, bob_, "com.example.app", QRVContainerClassAppBundle), bundle, &error));
  stored = storedPlist(bundle);
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->get(QRVMetadata::kUserIdentityKey), nullptr);
  EXPECT_EQ(stored->get(QRVMetadata::kInfoKey), nullptr);
  EXPECT_EQ(stored->get(QRVMetadata::kUserManagedAssetsDirNameKey), nullptr);
  back = read(bundle, bob_, true, &error);
  ASSERT_NE(back, nullptr) << error.description();
  EXPECT_TRUE(back->info().isNone());
}

TEST_F(MetadataTest, WritesGoThroughStagingAndLeaveNothingBehind) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  auto id = identity(uuid, alice_, "com.example.app", QRVContainerClassAppData);
  const std::string staging = config().stagingDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData);
  // Something planted at the temporary name is replaced, never written through.
  const std::string outside = env_.root.path() + "/outside";
  writeBytes(outside, {'k', 'e', 'e', 'p'});
  fs::create_symlink(outside, staging + "/temp_metadata-" + uuid.string() + ".plist");

  QRVError error;
  ASSERT_TRUE(write(id, dir, &error, QRVPlist::dictionary().set("n", QRVPlist::uinteger(1)))) << error.description();
  ASSERT_TRUE(write(id, dir, &error, QRVPlist::dictionary().set("n", QRVPlist::uinteger(2))));
  EXPECT_EQ(fileBytes(outside), (std::vector<uint8_t>{'k', 'e', 'e', 'p'}));
  EXPECT_TRUE(namesIn(staging).empty());
  EXPECT_EQ(namesIn(dir), std::vector<std::string>{QRVMetadata::kFileName});
  auto back = read(dir, alice_, true, &error);
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(back->info().uint64ForKey("n"), 2u);
}

TEST_F(MetadataTest, AFailedWriteIsCode34AndCleansStaging) {
  QRVUUID uuid = QRVUUID::random();
  auto id = identity(uuid, alice_, "com.example.app", QRVContainerClassAppData);
  const std::string staging = config().stagingDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData);
  QRVError error;
  // The move fails: no such container directory.
  EXPECT_FALSE(write(id, env_.root.path() + "/no/such/container/" + uuid.string(), &error));
  EXPECT_EQ(error.code(), 34u);
  EXPECT_TRUE(namesIn(staging).empty());

  // The temporary file cannot be made: a non-empty directory holds its name.
  fs::create_directories(staging + "/temp_metadata-" + uuid.string() + ".plist/x");
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  EXPECT_FALSE(write(id, dir, &error));
  EXPECT_EQ(error.code(), 34u);
  EXPECT_FALSE(fs::exists(dir + "/" + QRVMetadata::kFileName));
}

// ---- Validation ----

TEST_F(MetadataTest, EachFieldMissingOrOfTheWrongTypeIsRefusedWith29) {
  auto uuidBytes = QRVUUID::random().bytes();
  const QRVPlist malformedIdentity = QRVPlist::dictionary({{"version", QRVPlist::string("2")},
                                                           {"posixUID", QRVPlist::string("501")},
                                                           {"posixGID", QRVPlist::uinteger(501)},
                                                           {"type", QRVPlist::uinteger(0)}});
  using Change = std::pair<const char*, std::optional<QRVPlist>>;  // no value: the key is removed
  const struct {
    std::vector<Change> changes;
    const char* message;  // a part of the expected message
  } faults[] = {
      {{{QRVMetadata::kIdentifierKey, std::nullopt}}, "Invalid metadata Identifier: (null) at "},
      {{{QRVMetadata::kIdentifierKey, QRVPlist::uinteger(7)}}, "Invalid metadata Identifier: 7 at "},
      {{{QRVMetadata::kUUIDKey, std::nullopt}}, "Invalid metadata UUID String: (null) at "},
      {{{QRVMetadata::kUUIDKey, QRVPlist::data({uuidBytes.begin(), uuidBytes.end()})}}, "Invalid metadata UUID String"},
      {{{QRVMetadata::kUUIDKey, QRVPlist::string("not-a-uuid")}}, "Invalid metadata UUID: not-a-uuid at "},
      {{{QRVMetadata::kContentClassKey, std::nullopt}}, "Invalid metadata Class: (null) at "},
      {{{QRVMetadata::kContentClassKey, QRVPlist::string("2")}}, "Invalid metadata Class: "},
      {{{QRVMetadata::kContentClassKey, QRVPlist::uinteger(0)}}, "Invalid metadata Content Class: 0 at "},
      {{{QRVMetadata::kContentClassKey, QRVPlist::uinteger(14)}}, "Invalid metadata Content Class: 14 at "},
      {{{QRVMetadata::kPersonaKey, QRVPlist::uinteger(502)}}, "Incorrect UserId: 502, expecting: 501 for "},
      {{{QRVMetadata::kPersonaKey, QRVPlist::string("501")}}, "Incorrect UserId: \"501\", expecting: 501"},
      {{{QRVMetadata::kUserIdentityKey, bob_->plist()}}, "Incorrect User Identity: "},
      {{{QRVMetadata::kUserIdentityKey, QRVPlist::string("501")}}, "Incorrect User Identity: "},
      {{{QRVMetadata::kUserIdentityKey, malformedIdentity}}, ": 75"},
      {{{QRVMetadata::kInfoKey, QRVPlist::array()}}, "Invalid metadata Info: "},
      {{{QRVMetadata::kUserManagedAssetsDirNameKey, QRVPlist::uinteger(1)}},
       "Invalid metadata User Managed Dir Name String: 1 at "},
      // Checks run in a fixed order: the first fault found is the one reported.
      {{{QRVMetadata::kInfoKey, QRVPlist::array()},
        {QRVMetadata::kContentClassKey, QRVPlist::uinteger(14)},
        {QRVMetadata::kUUIDKey, QRVPlist::string("x")}},
       "Invalid metadata UUID: x"},
  };
  for (const auto& fault : faults) {
    SCOPED_TRACE(fault.message);
    QRVUUID uuid = QRVUUID::random();
    std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
    QRVPlist d = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_);
    for (const auto& [key, value] : fault.changes) value ? (void)d.set(key, *value) : d.remove(key);
    writePlist(dir, d);
    QRVError error;
    EXPECT_EQ(read(dir, alice_, true, &error), nullptr);
    EXPECT_EQ(error.domain(), QRVError::kDomain);
    EXPECT_EQ(error.code(), 29u);
    EXPECT_NE(error.message().find(fault.message), std::string::npos) << error.message();
  }

  // An empty identifier is a string, but no container's.
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  writePlist(dir, validPlist("", uuid, QRVContainerClassAppData, alice_));
  EXPECT_EQ(readCode(dir, alice_), 18u);
}

TEST_F(MetadataTest, OwnershipComesFromTheStoredIdentityOrOlderFilesPersonaKey) {
  // Another user's file is not alice's, but it is bob's, and reading it
  // changes nothing on disk.
  QRVUUID bobsUUID = QRVUUID::random();
  std::string bobs = containerDirectory(bob_, QRVContainerClassAppData, bobsUUID);
  ASSERT_TRUE(write(identity(bobsUUID, bob_, "com.example.app", QRVContainerClassAppData), bobs, nullptr));
  EXPECT_EQ(readCode(bobs, alice_), 29u);
  QRVError error;
  auto m = read(bobs, bob_, true, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_EQ(m->userIdentity()->identifier(), "502");
  EXPECT_EQ(storedPlist(bobs)->get(QRVMetadata::kPersonaKey), nullptr);

  // No user identity, the owner's uid under the legacy key.
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  QRVPlist d = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_);
  d.remove(QRVMetadata::kUserIdentityKey);
  d.set(QRVMetadata::kPersonaKey, QRVPlist::uinteger(501));
  writePlist(dir, d);
  m = read(dir, alice_, true, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_EQ(m->userIdentity()->identifier(), "501");
  EXPECT_EQ(m->userIdentity()->personaType(), QRVPersonaTypePersonal);

  // Neither key: the file is taken to be the expected owner's.
  d.remove(QRVMetadata::kPersonaKey);
  writePlist(dir, d);
  m = read(dir, bob_, false, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_EQ(m->userIdentity()->posixUID(), 502u);

  // Classes without a user identity ignore both keys, whatever they hold.
  QRVUUID bundleUUID = QRVUUID::random();
  std::string bundle = containerDirectory(alice_, QRVContainerClassAppBundle, bundleUUID);
  QRVPlist b = validPlist("com.example.app", bundleUUID, QRVContainerClassAppBundle, alice_);
  b.set(QRVMetadata::kUserIdentityKey, QRVPlist::string("junk"));
  b.set(QRVMetadata::kPersonaKey, QRVPlist::string("junk"));
  writePlist(bundle, b);
  m = read(bundle, nullptr, true, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_TRUE(m->userIdentity()->isEqualToUserIdentity(*identities().defaultUserIdentity()));
}

TEST_F(MetadataTest, TheClassPathCheckCatchesAContainerInAnotherClassesTree) {
  // A class-2 container found under the plug-in data tree.
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassPluginData, uuid);
  writePlist(dir, validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_));
  QRVError error;
  EXPECT_EQ(read(dir, alice_, true, &error), nullptr);
  const std::string containers = alice_->homeDirectoryURL() + "/Containers/";
  EXPECT_EQ(error.message(), "Invalid metadata-URLs should match: " + containers + "Data/Application : " + containers +
                                 "Data/SpindlePlugin");
  EXPECT_EQ(readCode(dir, alice_, false), 0u);

  // Transient trees pass the check as well as live ones.
  QRVUUID transientUUID = QRVUUID::random();
  std::string transient = containerDirectory(alice_, QRVContainerClassAppData, transientUUID, true);
  writePlist(transient, validPlist("com.example.app", transientUUID, QRVContainerClassAppData, alice_));
  EXPECT_EQ(readCode(transient, alice_), 0u);
}

TEST_F(MetadataTest, UnreadableFilesAreCode12AndNeverFollowedOrBlockedOn) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  const std::string file = dir + "/" + QRVMetadata::kFileName;
  std::vector<uint8_t> good = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_).toBinary();
  auto expect12 = [&](const std::string& what, const std::string& container) {
    SCOPED_TRACE(what);
    QRVError error;
    EXPECT_EQ(read(container, alice_, false, &error), nullptr);
    EXPECT_EQ(error.code(), 12u);
    EXPECT_EQ(error.message(), "Failed to read metadata at URL " + container);
  };

  expect12("missing", dir);
  for (size_t cut : {size_t(0), size_t(8), good.size() / 2, good.size() - 1}) {
    writeBytes(file, std::vector<uint8_t>(good.begin(), good.begin() + static_cast<long>(cut)));
    expect12("truncated at " + std::to_string(cut), dir);
  }
  writeBytes(file, {0x00, 0xff, 'g', 'a', 'r', 'b', 'a', 'g', 'e'});
  expect12("garbage", dir);
  writeBytes(file, QRVPlist::array({QRVPlist::string("x")}).toBinary());
  expect12("an array", dir);

  // A link to a good file elsewhere is not the file.
  const std::string elsewhere = env_.root.path() + "/elsewhere.plist";
  writeBytes(elsewhere, good);
  fs::remove(file);
  fs::create_symlink(elsewhere, file);
  expect12("a link", dir);
  fs::remove(file);
  // Neither is a fifo, and reading it must not wait for a writer.
  ASSERT_EQ(mkfifo(file.c_str(), 0644), 0);
  auto start = std::chrono::steady_clock::now();
  expect12("a fifo", dir);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  fs::remove(file);
  fs::create_directory(file);
  expect12("a directory", dir);
  fs::remove(file);
  // A huge (sparse) file is refused without being read.
  int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(ftruncate(fd, static_cast<off_t>(QRVMetadata::kMaximumFileSize) + 1), 0);
  close(fd);
  expect12("too large", dir);

  // An XML file with the right content is accepted.
  std::string xml = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_).toXML();
  writeBytes(file, std::vector<uint8_t>(xml.begin(), xml.end()));
  EXPECT_EQ(readCode(dir, alice_), 0u);
  // A container directory that is itself a link to a good container is not.
  std::string link = *config().containerDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData, false) + "/" +
                     QRVUUID::random().string();
  fs::create_directory_symlink(dir, link);
  expect12("a linked container", link);
}

TEST_F(MetadataTest, OddIdentifiersAreKeptAsTextAndTouchNothingElse) {
  for (const std::string identifier : {"../../../etc/passwd", "with space/and\nnewline", "ünïcødé.日本", "%@%s{}"}) {
    SCOPED_TRACE(identifier);
    QRVUUID uuid = QRVUUID::random();
    std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
    auto id = identity(uuid, alice_, identifier, QRVContainerClassAppData);
    ASSERT_NE(id, nullptr);
    QRVError error;
    ASSERT_TRUE(write(id, dir, &error)) << error.description();
    EXPECT_EQ(namesIn(dir), std::vector<std::string>{QRVMetadata::kFileName});
    auto back = read(dir, alice_, true, &error);
    ASSERT_NE(back, nullptr) << error.description();
    EXPECT_EQ(back->identifier(), identifier);
  }
}

}  // namespace
