#include "QRVMetadata.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
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
  std::string containerDirectory(const QRVUserIdentityRef& u, QRVContainerClass c, const QRVUUID& uuid) {
    std::string dir = *config().containerDirectoryURLForUserIdentity(u, c, false) + "/" + uuid.string();
    fs::create_directories(dir);
    return dir;
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

  QRVMetadataRef read(const std::string& dir, const QRVUserIdentityRef& expected, bool checkClassPath,
                      QRVError* error) {
    return QRVMetadata::readAndValidateMetadataAtUrl(dir, expected, checkClassPath, fm(), identities(), error);
  }

  QRVTestServices env_;
  QRVUserIdentityRef alice_;
  QRVUserIdentityRef bob_;
};

// ---- Writing ----

TEST_F(MetadataTest, WriteThenReadRoundTripsEveryField) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, alice_, "com.example.app",
                                                                          QRVContainerClassAppData, nullptr);
  ASSERT_NE(identity, nullptr);
  QRVPlist info = QRVPlist::dictionary().set("com.kelva.Verdane.ContentProtectionClass", QRVPlist::uinteger(3));
  auto written = QRVMetadata::make(*identity, info, dir, "Assets");
  QRVError error;
  ASSERT_TRUE(written->writeMetadataToDisk(fm(), config(), &error)) << error.description();

  const std::string file = dir + "/" + QRVMetadata::kFileName;
  std::vector<uint8_t> bytes = fileBytes(file);
  ASSERT_GE(bytes.size(), 8u);
  EXPECT_EQ(std::string(bytes.begin(), bytes.begin() + 8), "bplist00");
  auto stored = QRVPlist::fromBinary(bytes.data(), bytes.size());
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->stringForKey(QRVMetadata::kVersionKey), "2");
  EXPECT_EQ(stored->uint64ForKey(QRVMetadata::kContentClassKey), 2u);
  EXPECT_EQ(stored->stringForKey(QRVMetadata::kUUIDKey), uuid.string());
  EXPECT_EQ(*stored->get(QRVMetadata::kUserIdentityKey), alice_->plist());
  EXPECT_EQ(stored->stringForKey(QRVMetadata::kUserManagedAssetsDirNameKey), "Assets");
  EXPECT_EQ(stored->get(QRVMetadata::kPersonaKey), nullptr);  // never written

  struct stat st;
  ASSERT_EQ(lstat(file.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_TRUE(S_ISREG(st.st_mode));
  // No data-protection class is asked for.
  uint32_t protectionClass = 99;
  ASSERT_TRUE(fm().dataProtectionClassOfItemAtURL(file, &protectionClass, nullptr));
  EXPECT_EQ(protectionClass, 0u);

  auto back = read(dir, alice_, true, &error);
  ASSERT_NE(back, nullptr) << error.description();
  EXPECT_EQ(back->identifier(), "com.example.app");
  EXPECT_EQ(back->uuid(), uuid);
  EXPECT_EQ(back->containerClass(), QRVContainerClassAppData);
  EXPECT_TRUE(back->userIdentity()->isEqualToUserIdentity(*alice_));
  EXPECT_EQ(back->url(), dir);
  EXPECT_EQ(back->info(), info);
  EXPECT_EQ(back->userManagedAssetsDirName(), "Assets");
  EXPECT_FALSE(back->transient());
  EXPECT_FALSE(back->existed());
  EXPECT_TRUE(back->containerIdentity()->isEqual(*identity));
  // Values are immutable: changes make copies.
  auto moved = back->withURL("/b")->withTransient(true)->withExisted(true);
  EXPECT_EQ(back->url(), dir);
  EXPECT_FALSE(back->transient() || back->existed());
  EXPECT_EQ(moved->metadataFileURL(), std::string("/b/") + QRVMetadata::kFileName);
  EXPECT_TRUE(moved->transient() && moved->existed());
}

TEST_F(MetadataTest, BundleFilesCarryNoUserIdentityAndReadBackWithTheDefaultOne) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppBundle, uuid);
  auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, bob_, "com.example.app",
                                                                          QRVContainerClassAppBundle, nullptr);
  QRVError error;
  ASSERT_TRUE(QRVMetadata::make(*identity, QRVPlist(), dir, "")->writeMetadataToDisk(fm(), config(), &error));
  std::vector<uint8_t> bytes = fileBytes(dir + "/" + QRVMetadata::kFileName);
  auto stored = QRVPlist::fromBinary(bytes.data(), bytes.size());
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->get(QRVMetadata::kUserIdentityKey), nullptr);
  EXPECT_EQ(stored->get(QRVMetadata::kInfoKey), nullptr);
  EXPECT_EQ(stored->get(QRVMetadata::kUserManagedAssetsDirNameKey), nullptr);
  EXPECT_EQ(stored->stringForKey(QRVMetadata::kVersionKey), "2");

  // Whoever asks, a bundle belongs to the default identity.
  auto back = read(dir, bob_, true, &error);
  ASSERT_NE(back, nullptr) << error.description();
  EXPECT_TRUE(back->userIdentity()->isEqualToUserIdentity(*identities().defaultUserIdentity()));
  EXPECT_TRUE(back->info().isNone());
}

TEST_F(MetadataTest, WritesGoThroughStagingAndLeaveNothingBehind) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, alice_, "com.example.app",
                                                                          QRVContainerClassAppData, nullptr);
  const std::string staging = config().stagingDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData);
  const std::string temporary = staging + "/temp_metadata-" + uuid.string() + ".plist";
  // Something planted at the temporary name is replaced, never written
  // through.
  const std::string outside = env_.root.path() + "/outside";
  writeBytes(outside, {'k', 'e', 'e', 'p'});
  fs::create_symlink(outside, temporary);

  auto m = QRVMetadata::make(*identity, QRVPlist::dictionary().set("n", QRVPlist::uinteger(1)), dir, "");
  QRVError error;
  ASSERT_TRUE(m->writeMetadataToDisk(fm(), config(), &error)) << error.description();
  // A rewrite replaces the file whole.
  ASSERT_TRUE(m->withInfo(QRVPlist::dictionary().set("n", QRVPlist::uinteger(2)))
                  ->writeMetadataToDisk(fm(), config(), &error));

  EXPECT_EQ(fileBytes(outside), (std::vector<uint8_t>{'k', 'e', 'e', 'p'}));
  EXPECT_TRUE(namesIn(staging).empty());
  EXPECT_EQ(namesIn(dir), std::vector<std::string>{QRVMetadata::kFileName});
  auto back = read(dir, alice_, true, &error);
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(back->info().uint64ForKey("n"), 2u);

  // Global classes stage in the daemon's own staging directory.
  QRVUUID systemUUID = QRVUUID::random();
  std::string systemDir = containerDirectory(alice_, QRVContainerClassSystemData, systemUUID);
  auto system = QRVConcreteContainerIdentity::containerIdentityWithUUID(
      systemUUID, identities().defaultUserIdentity(), "com.example.daemon", QRVContainerClassSystemData, nullptr);
  ASSERT_TRUE(QRVMetadata::make(*system, QRVPlist(), systemDir, "")->writeMetadataToDisk(fm(), config(), &error));
  EXPECT_TRUE(namesIn(config().stagingDirectory()).empty());
  EXPECT_NE(read(systemDir, alice_, true, nullptr), nullptr);
}

TEST_F(MetadataTest, AFailedWriteIsCode34AndCleansStaging) {
  QRVUUID uuid = QRVUUID::random();
  auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, alice_, "com.example.app",
                                                                          QRVContainerClassAppData, nullptr);
  const std::string missing = env_.root.path() + "/no/such/container/" + uuid.string();
  QRVError error;
  EXPECT_FALSE(QRVMetadata::make(*identity, QRVPlist(), missing, "")->writeMetadataToDisk(fm(), config(), &error));
  EXPECT_EQ(error.code(), 34u);
  EXPECT_NE(error.message().find("Failed to move metadata from staging: "), std::string::npos) << error.message();
  EXPECT_TRUE(namesIn(config().stagingDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData)).empty());

  // The temporary file itself cannot be made: staging is occupied by a
  // directory of that name that is not empty.
  const std::string staging = config().stagingDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData);
  fs::create_directories(staging + "/temp_metadata-" + uuid.string() + ".plist/x");
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  EXPECT_FALSE(QRVMetadata::make(*identity, QRVPlist(), dir, "")->writeMetadataToDisk(fm(), config(), &error));
  EXPECT_EQ(error.code(), 34u);
  EXPECT_NE(error.message().find("Failed to write metadata dictionary to URL "), std::string::npos);
  EXPECT_FALSE(fs::exists(dir + "/" + QRVMetadata::kFileName));
}

// ---- Validation ----

struct Fault {
  const char* name;
  std::function<void(QRVPlist&, const QRVUserIdentityRef& other)> change;
  uint64_t code;
  const char* message;  // a part of the expected message
};

TEST_F(MetadataTest, EachFieldMissingOrOfTheWrongTypeIsRefused) {
  const std::vector<Fault> faults = {
      {"identifier missing", [](QRVPlist& d, auto&) { d.remove(QRVMetadata::kIdentifierKey); }, 29,
       "Invalid metadata Identifier: (null) at "},
      {"identifier a number", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kIdentifierKey, QRVPlist::uinteger(7)); },
       29, "Invalid metadata Identifier: 7 at "},
      {"uuid missing", [](QRVPlist& d, auto&) { d.remove(QRVMetadata::kUUIDKey); }, 29,
       "Invalid metadata UUID String: (null) at "},
      {"uuid as data",
       [](QRVPlist& d, auto&) {
         auto b = QRVUUID::random().bytes();
         d.set(QRVMetadata::kUUIDKey, QRVPlist::data({b.begin(), b.end()}));
       },
       29, "Invalid metadata UUID String: "},
      {"uuid malformed", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kUUIDKey, QRVPlist::string("not-a-uuid")); }, 29,
       "Invalid metadata UUID: not-a-uuid at "},
      {"class missing", [](QRVPlist& d, auto&) { d.remove(QRVMetadata::kContentClassKey); }, 29,
       "Invalid metadata Class: (null) at "},
      {"class a string", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kContentClassKey, QRVPlist::string("2")); }, 29,
       "Invalid metadata Class: "},
      {"class a real", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kContentClassKey, QRVPlist::real(2.0)); }, 29,
       "Invalid metadata Class: "},
      {"class 0", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kContentClassKey, QRVPlist::uinteger(0)); }, 29,
       "Invalid metadata Content Class: 0 at "},
      {"class 14", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kContentClassKey, QRVPlist::uinteger(14)); }, 29,
       "Invalid metadata Content Class: 14 at "},
      {"persona of another uid", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kPersonaKey, QRVPlist::uinteger(502)); },
       29, "Incorrect UserId: 502, expecting: 501 for com.example.app at "},
      {"persona a string", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kPersonaKey, QRVPlist::string("501")); }, 29,
       "Incorrect UserId: \"501\", expecting: 501"},
      {"another user's identity",
       [](QRVPlist& d, const QRVUserIdentityRef& other) { d.set(QRVMetadata::kUserIdentityKey, other->plist()); },
       29, "Incorrect User Identity: "},
      {"identity not a dictionary",
       [](QRVPlist& d, auto&) { d.set(QRVMetadata::kUserIdentityKey, QRVPlist::string("501")); }, 29,
       "Incorrect User Identity: "},
      {"identity with a malformed uid",
       [](QRVPlist& d, auto&) {
         QRVPlist u = QRVPlist::dictionary();
         u.set("version", QRVPlist::string("2"));
         u.set("posixUID", QRVPlist::string("501"));
         u.set("posixGID", QRVPlist::uinteger(501));
         u.set("type", QRVPlist::uinteger(0));
         d.set(QRVMetadata::kUserIdentityKey, u);
       },
       29, ": 75"},
      {"info an array", [](QRVPlist& d, auto&) { d.set(QRVMetadata::kInfoKey, QRVPlist::array()); }, 29,
       "Invalid metadata Info: "},
      {"assets name a number",
       [](QRVPlist& d, auto&) { d.set(QRVMetadata::kUserManagedAssetsDirNameKey, QRVPlist::uinteger(1)); }, 29,
       "Invalid metadata User Managed Dir Name String: 1 at "},
      // Checks run in a fixed order: the first fault found is the one
      // reported.
      {"several faults",
       [](QRVPlist& d, auto&) {
         d.set(QRVMetadata::kInfoKey, QRVPlist::array());
         d.set(QRVMetadata::kContentClassKey, QRVPlist::uinteger(14));
         d.set(QRVMetadata::kUUIDKey, QRVPlist::string("x"));
       },
       29, "Invalid metadata UUID: x"},
  };
  for (const Fault& fault : faults) {
    QRVUUID uuid = QRVUUID::random();
    std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
    QRVPlist d = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_);
    fault.change(d, bob_);
    writeBytes(dir + "/" + QRVMetadata::kFileName, d.toBinary());
    QRVError error;
    EXPECT_EQ(read(dir, alice_, true, &error), nullptr) << fault.name;
    EXPECT_EQ(error.code(), fault.code) << fault.name;
    EXPECT_EQ(error.domain(), QRVError::kDomain) << fault.name;
    EXPECT_NE(error.message().find(fault.message), std::string::npos) << fault.name << ": " << error.message();
  }
}

TEST_F(MetadataTest, AnotherUsersFileIsNotTheirs) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(bob_, QRVContainerClassAppData, uuid);
  auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, bob_, "com.example.app",
                                                                          QRVContainerClassAppData, nullptr);
  ASSERT_TRUE(QRVMetadata::make(*identity, QRVPlist(), dir, "")->writeMetadataToDisk(fm(), config(), nullptr));
  QRVError error;
  EXPECT_EQ(read(dir, alice_, true, &error), nullptr);
  EXPECT_EQ(error.code(), 29u);
  EXPECT_EQ(error.message().rfind("Incorrect User Identity: ", 0), 0u) << error.message();
  EXPECT_NE(error.message().find(" for com.example.app at " + dir), std::string::npos) << error.message();
  auto mine = read(dir, bob_, true, &error);
  ASSERT_NE(mine, nullptr);
  EXPECT_EQ(mine->userIdentity()->identifier(), "502");
  // Reading changed nothing on disk.
  auto stored = QRVPlist::fromBytes(fileBytes(dir + "/" + QRVMetadata::kFileName).data(),
                                    fileBytes(dir + "/" + QRVMetadata::kFileName).size());
  EXPECT_EQ(stored->get(QRVMetadata::kPersonaKey), nullptr);
}

TEST_F(MetadataTest, OlderFilesFallBackToThePersonaKey) {
  // No user identity, the owner's uid under the legacy key.
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  QRVPlist d = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_);
  d.remove(QRVMetadata::kUserIdentityKey);
  d.set(QRVMetadata::kPersonaKey, QRVPlist::uinteger(501));
  writeBytes(dir + "/" + QRVMetadata::kFileName, d.toBinary());
  QRVError error;
  auto m = read(dir, alice_, true, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_EQ(m->userIdentity()->identifier(), "501");
  EXPECT_EQ(m->userIdentity()->personaType(), QRVPersonaTypePersonal);

  // Neither key: the file is taken to be the expected owner's.
  d.remove(QRVMetadata::kPersonaKey);
  writeBytes(dir + "/" + QRVMetadata::kFileName, d.toBinary());
  m = read(dir, bob_, false, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_EQ(m->userIdentity()->posixUID(), 502u);

  // 499 stands for uid 0; every other value for itself.
  EXPECT_EQ(QRVMetadata::_uidForLegacyPersonaValue(499), 0u);
  EXPECT_EQ(QRVMetadata::_uidForLegacyPersonaValue(501), 501u);
  EXPECT_EQ(QRVMetadata::_uidForLegacyPersonaValue(0), 0u);
  EXPECT_EQ(QRVMetadata::_uidForLegacyPersonaValue(498), 498u);

  // Classes without a user identity ignore both keys, whatever they hold.
  QRVUUID bundleUUID = QRVUUID::random();
  std::string bundle = containerDirectory(alice_, QRVContainerClassAppBundle, bundleUUID);
  QRVPlist b = validPlist("com.example.app", bundleUUID, QRVContainerClassAppBundle, alice_);
  b.set(QRVMetadata::kUserIdentityKey, QRVPlist::string("junk"));
  b.set(QRVMetadata::kPersonaKey, QRVPlist::string("junk"));
  writeBytes(bundle + "/" + QRVMetadata::kFileName, b.toBinary());
  m = read(bundle, nullptr, true, &error);
  ASSERT_NE(m, nullptr) << error.description();
  EXPECT_TRUE(m->userIdentity()->isEqualToUserIdentity(*identities().defaultUserIdentity()));
}

TEST_F(MetadataTest, TheClassPathCheckCatchesAContainerInAnotherClassesTree) {
  QRVUUID uuid = QRVUUID::random();
  // A class-2 container found under the plug-in data tree.
  std::string dir = containerDirectory(alice_, QRVContainerClassPluginData, uuid);
  writeBytes(dir + "/" + QRVMetadata::kFileName,
             validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_).toBinary());
  QRVError error;
  EXPECT_EQ(read(dir, alice_, true, &error), nullptr);
  EXPECT_EQ(error.code(), 29u);
  const std::string containers = alice_->homeDirectoryURL() + "/Containers/";
  EXPECT_EQ(error.message(), "Invalid metadata-URLs should match: " + containers + "Data/Application : " +
                                 containers + "Data/SpindlePlugin");
  EXPECT_NE(read(dir, alice_, false, &error), nullptr);

  // Transient trees pass the check as well as live ones.
  QRVUUID transientUUID = QRVUUID::random();
  std::string transient =
      *config().containerDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData, true) + "/" +
      transientUUID.string();
  fs::create_directories(transient);
  writeBytes(transient + "/" + QRVMetadata::kFileName,
             validPlist("com.example.app", transientUUID, QRVContainerClassAppData, alice_).toBinary());
  EXPECT_NE(read(transient, alice_, true, &error), nullptr) << error.description();
}

TEST_F(MetadataTest, UnreadableFilesAreCode12AndNeverFollowedOrBlockedOn) {
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  const std::string file = dir + "/" + QRVMetadata::kFileName;
  std::vector<uint8_t> good = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_).toBinary();
  auto expect12 = [&](const char* what) {
    QRVError error;
    EXPECT_EQ(read(dir, alice_, true, &error), nullptr) << what;
    EXPECT_EQ(error.code(), 12u) << what;
    EXPECT_EQ(error.message(), "Failed to read metadata at URL " + dir) << what;
  };

  expect12("missing");
  writeBytes(file, {});
  expect12("empty");
  writeBytes(file, std::vector<uint8_t>(good.begin(), good.begin() + static_cast<long>(good.size() / 2)));
  expect12("truncated");
  for (size_t cut : {size_t(8), good.size() - 1}) {
    writeBytes(file, std::vector<uint8_t>(good.begin(), good.begin() + static_cast<long>(cut)));
    expect12("truncated at an edge");
  }
  writeBytes(file, {0x00, 0xff, 'g', 'a', 'r', 'b', 'a', 'g', 'e'});
  expect12("garbage");
  writeBytes(file, QRVPlist::array({QRVPlist::string("x")}).toBinary());
  expect12("an array");
  // Flipping single bytes of a good file never crashes the reader.
  for (size_t i = 8; i < good.size(); i += 7) {
    std::vector<uint8_t> bad = good;
    bad[i] ^= 0x5a;
    writeBytes(file, bad);
    QRVError error;
    auto m = read(dir, alice_, true, &error);
    if (!m) {
      EXPECT_TRUE(error.code() == 12 || error.code() == 29) << i << ": " << error.description();
    }
  }

  // A link to a good file elsewhere is not the file.
  const std::string elsewhere = env_.root.path() + "/elsewhere.plist";
  writeBytes(elsewhere, good);
  fs::remove(file);
  fs::create_symlink(elsewhere, file);
  expect12("a link");
  fs::remove(file);
  // Neither is a fifo, and reading it must not wait for a writer.
  ASSERT_EQ(mkfifo(file.c_str(), 0644), 0);
  auto start = std::chrono::steady_clock::now();
  expect12("a fifo");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  fs::remove(file);
  fs::create_directory(file);
  expect12("a directory");
  fs::remove(file);
  // A huge (sparse) file is refused without being read.
  {
    int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, static_cast<off_t>(QRVMetadata::kMaximumFileSize) + 1), 0);
    close(fd);
  }
  expect12("too large");

  // An XML file with the right content is accepted.
  writeBytes(file, {});
  std::string xml = validPlist("com.example.app", uuid, QRVContainerClassAppData, alice_).toXML();
  writeBytes(file, std::vector<uint8_t>(xml.begin(), xml.end()));
  EXPECT_NE(read(dir, alice_, true, nullptr), nullptr);

  // A container directory that is itself a link to a good container is
  // refused too.
  QRVUUID linkUUID = QRVUUID::random();
  std::string link = *config().containerDirectoryURLForUserIdentity(alice_, QRVContainerClassAppData, false) + "/" +
                     linkUUID.string();
  fs::create_directory_symlink(dir, link);
  QRVError error;
  EXPECT_EQ(read(link, alice_, false, &error), nullptr);
  EXPECT_EQ(error.code(), 12u);
}

TEST_F(MetadataTest, OddIdentifiersAreKeptAsTextAndTouchNothingElse) {
  for (const std::string identifier : {"../../../etc/passwd", "with space/and\nnewline", "ünïcødé.日本", "%@%s{}"}) {
    QRVUUID uuid = QRVUUID::random();
    std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
    auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, alice_, identifier,
                                                                            QRVContainerClassAppData, nullptr);
    ASSERT_NE(identity, nullptr);
    QRVError error;
    ASSERT_TRUE(QRVMetadata::make(*identity, QRVPlist(), dir, "")->writeMetadataToDisk(fm(), config(), &error))
        << error.description();
    EXPECT_EQ(namesIn(dir), std::vector<std::string>{QRVMetadata::kFileName});
    auto back = read(dir, alice_, true, &error);
    ASSERT_NE(back, nullptr) << error.description();
    EXPECT_EQ(back->identifier(), identifier);
  }
  // An empty identifier is a string, but no container's.
  QRVUUID uuid = QRVUUID::random();
  std::string dir = containerDirectory(alice_, QRVContainerClassAppData, uuid);
  writeBytes(dir + "/" + QRVMetadata::kFileName, validPlist("", uuid, QRVContainerClassAppData, alice_).toBinary());
  QRVError error;
  EXPECT_EQ(read(dir, alice_, true, &error), nullptr);
  EXPECT_EQ(error.code(), 18u);
}

}  // namespace
