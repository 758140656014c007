// The catalog retrieval, the import and the signature copy against a volume
// that stands in for the mounted share: which file lands in ramfs:, what the
// provisioning variables remember, the console lines that matter, and that
// no pool block is left behind.
#include "HostImageFixture.h"
#include "NwFsDrv.h"
#include "ProvisioningVars.h"
#include "ShareStandIn.h"
#include "ShellCommand.h"
#include "Tasks.h"

namespace {

namespace fs = std::filesystem;

class TasksTest : public ShareTaskTest {
protected:
  EFI_STATUS Catalog(const CHAR16 *Directory, std::string *Out = nullptr) {
    return Captured(Out,
                    [&] { return GetCatalogFromNwFS(NWFS_SHARE_TYPE_CIFS, Directory, FALSE); });
  }

  EFI_STATUS Import(const CHAR16 *Path, std::string *Out = nullptr) {
    return Captured(Out, [&] { return GetFileFromNWFS(NWFS_SHARE_TYPE_CIFS, Path, u"ramfs:\\"); });
  }
};

// ---------------------------------------------------------------------------
// Catalog retrieval
// ---------------------------------------------------------------------------

TEST_F(TasksTest, DefaultPlacesAreTriedInOrderAndTheFirstCatalogWins) {
  struct Case {
    const char *Name;
    std::vector<std::string> Files; // relative to the share
    std::string Persisted;
    UINT32 Kind;
    std::string Copied;
  };
  const Case Cases[] = {
      {"root", {"catalog.xml.gz", "catalog/catalog.xml"}, "CIFS:", 2, "catalog.xml.gz"},
      {"catalog dir",
       {"catalog/catalog.xml", "repository/catalog.xml.gz"},
       "CIFS:\\catalog",
       1,
       "catalog.xml"},
      {"repository only", {"repository/catalog.xml.gz"}, "CIFS:\\repository", 2, "catalog.xml.gz"},
      {"both kinds: the compressed one",
       {"catalog/catalog.xml", "catalog/catalog.xml.gz"},
       "CIFS:\\catalog",
       2,
       "catalog.xml.gz"},
  };
  for (const Case &C : Cases) {
    SCOPED_TRACE(C.Name);
    fs::remove_all(ShareDir);
    fs::create_directories(ShareDir);
    fs::remove(RamfsDir + "/catalog.xml");
    fs::remove(RamfsDir + "/catalog.xml.gz");
    for (const std::string &File : C.Files) {
      WriteFile(ShareDir + "/" + File, "content of " + File);
    }
    SeedTextFields();
    std::string Out;
    EXPECT_EQ(Catalog(nullptr, &Out), EFI_SUCCESS) << Out;
    EXPECT_EQ(PersistedCatalogPath(), C.Persisted);
    EXPECT_EQ(CatalogKind(), C.Kind);
    std::string Source = C.Persisted == "CIFS:" ? C.Copied : C.Persisted.substr(6) + "/" + C.Copied;
    EXPECT_EQ(ReadFile(RamfsDir + "/" + C.Copied), "content of " + Source);
    EXPECT_NE(Out.find("found catalog file"), std::string::npos);
    ExpectNoPoolLeak();
  }
}

TEST_F(TasksTest, NoCatalogAnywhereLeavesTheKindAtZero) {
  SeedTextFields("CIFS:\\old");
  UINT32 Stale = 2;
  ASSERT_EQ(SetCatalogEnvVar(&Stale), EFI_SUCCESS);
  std::string Out;
  EXPECT_EQ(Catalog(nullptr, &Out), EFI_NOT_FOUND);
  EXPECT_EQ(CatalogKind(), 0u);
  EXPECT_EQ(PersistedCatalogPath(), "CIFS:\\old");
  EXPECT_FALSE(fs::exists(RamfsDir + "/catalog.xml.gz"));
  EXPECT_EQ(Out.find("found catalog file"), std::string::npos);
  // All three places, each with both kinds.
  EXPECT_EQ(Count(Out, "catalogFilePath = "), 6u);
  ExpectNoPoolLeak();
}

TEST_F(TasksTest, LongDirectoryIsCopiedButNotPersisted) {
  std::string Long(130, 'd');
  WriteFile(ShareDir + "/" + Long + "/catalog.xml.gz", "gz");
  SeedTextFields("CIFS:\\before");
  std::u16string Wide(Long.begin(), Long.end());
  std::string Out;
  EXPECT_EQ(Catalog(Wide.c_str(), &Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(ReadFile(RamfsDir + "/catalog.xml.gz"), "gz");
  EXPECT_EQ(PersistedCatalogPath(), "CIFS:\\before");
  EXPECT_EQ(CatalogKind(), 2u);
  EXPECT_NE(Out.find("Warning: CIFS catalog path too long. Unable to persist to the PU Env. "
                     "Variable\n"),
            std::string::npos);
  ExpectNoPoolLeak();
}

TEST_F(TasksTest, ShareIsMappedUnderItsIdentifierOnlyWhenItsNameDiffers) {
  // A partition-table label gets the shell name of its row ("catalog" for
  // "CATLOG"), which differs from the identifier; a quote in the identifier
  // makes the shell refuse to launch the map command line.
  const SHARE_MAPPING_STYLE Strict = {.NoDriveText = "none%ls\n",
                                      .NoDriveStatus = EFI_NOT_FOUND,
                                      .FailureText = u"failed %s\n",
                                      .FailureStatusLine = true};
  const SHARE_MAPPING_STYLE Lenient = {.FailureEnds = false};
  struct Case {
    const CHAR16 *Label; // of the share and the identifier; null: no share
    const SHARE_MAPPING_STYLE &Style;
    bool GoesOn;
    EFI_STATUS Status;
    const char *DriveName;
    std::vector<std::string> Lines; // in this order after the lookup's; none: nothing
  };
  const EFI_STATUS NotLaunched = static_cast<EFI_STATUS>(-1);
  const std::string Map = "trying to map --> command: map CATLOG";
  const std::string Quoted = Map + "\" catalog:\n";
  const Case Cases[] = {
      {u"CIFS", Strict, true, EFI_SUCCESS, "CIFS", {}},
      {u"CATLOG", Strict, true, EFI_SUCCESS, "catalog", {Map + " catalog:\n"}},
      {u"CATLOG\"", Strict, false, NotLaunched, "catalog", {Quoted, "failed map", "Status = [-1]"}},
      {u"CATLOG\"", Lenient, true, EFI_SUCCESS, "catalog", {Quoted}},
      {nullptr, Strict, false, EFI_NOT_FOUND, "", {"none\n"}},
      {nullptr, Lenient, true, EFI_SUCCESS, "", {}},
  };
  for (const Case &C : Cases) {
    SCOPED_TRACE(C.Label != nullptr ? HostUcs2ToUtf8(C.Label) : "no share");
    Share.Uninstall();
    if (C.Label != nullptr) {
      Console([&] { Share.Install(u"share", C.Label); });
    }
    uint64_t PoolBefore = HostPoolOutstanding();
    CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS + 1];
    EFI_STATUS Status = EFI_SUCCESS;
    bool GoesOn = false;
    std::string Out = Console([&] {
      GoesOn = MapShareUnderIdentifier(C.Label != nullptr ? C.Label : u"CIFS", C.Style, DriveName,
                                       &Status);
    });
    EXPECT_EQ(GoesOn, C.GoesOn);
    EXPECT_EQ(Status, C.Status);
    EXPECT_EQ(HostUcs2ToUtf8(DriveName), C.DriveName);
    const std::string Closing = "Exiting from GetFS_OLD_NWFS function \n";
    size_t At = Out.rfind(Closing) + Closing.size();
    EXPECT_EQ(At == Out.size(), C.Lines.empty()) << Out;
    for (const std::string &Line : C.Lines) {
      At = Out.find(Line, At);
      EXPECT_NE(At, std::string::npos) << Line << " in " << Out;
    }
    EXPECT_EQ(HostPoolOutstanding(), PoolBefore);
  }
}

// ---------------------------------------------------------------------------
// Import
// ---------------------------------------------------------------------------

TEST_F(TasksTest, ImportWithDirectoriesIsRetriedWithBackslashesAndStaysSuccessful) {
  // The copy lands in ramfs:\f.img while the check looks for ramfs:\dir\f.img:
  // the command is retried with '/' turned into '\' and reported, but the
  // copy itself worked, so the status is success.
  WriteFile(ShareDir + "/dir/f.img", "image");
  std::string Out;
  EXPECT_EQ(Import(u"dir/f.img", &Out), EFI_SUCCESS);
  EXPECT_EQ(ReadFile(RamfsDir + "/f.img"), "image");
  EXPECT_EQ(Count(Out, "command = [cp -q CIFS:\\dir/f.img ramfs:\\]"), 1u);
  EXPECT_EQ(Count(Out, "command = [cp -q CIFS:\\dir\\f.img ramfs:\\]"), 1u);
  EXPECT_NE(Out.find("GetFileFromNWFS(): command failed, cp -q CIFS:\\dir\\f.img ramfs:\\\n"),
            std::string::npos);
  ExpectNoPoolLeak();
}

TEST_F(TasksTest, ImportOfAMissingFileReportsTheCopyFailure) {
  std::string Out;
  EXPECT_EQ(Import(u"absent.img", &Out), EFI_NOT_FOUND);
  EXPECT_NE(Out.find("GetFileFromNWFS(): command failed"), std::string::npos);
  EXPECT_FALSE(fs::exists(RamfsDir + "/absent.img"));
  // Nor does an older file where the copy would have landed pass for it.
  WriteFile(RamfsDir + "/absent.img", "older copy");
  EXPECT_EQ(Import(u"absent.img", &Out), EFI_NOT_FOUND);
  EXPECT_FALSE(fs::exists(RamfsDir + "/absent.img"));
  ExpectNoPoolLeak();
}

// ---------------------------------------------------------------------------
// Signature copy
// ---------------------------------------------------------------------------

TEST_F(TasksTest, SignatureMissingOnTheShareIsReported) {
  SeedTextFields("CIFS:\\repository");
  EXPECT_EQ(Quiet([&] { return CopyCatalogSignatureToRamfs(); }), EFI_NOT_FOUND);
  ExpectNoPoolLeak();
}

TEST_F(TasksTest, AllocationFailuresAreReportedWithoutLeaks) {
  WriteFile(ShareDir + "/catalog/catalog.xml.gz", "gz");
  WriteFile(ShareDir + "/dir/image.bin", "payload");
  SeedTextFields();
  // Each allocation of the two tasks fails once in turn; whatever the task
  // makes of it, the pool must be as it was afterwards.
  int Failed = 0;
  for (uint64_t Allowed = 0; Allowed < 160; Allowed++) {
    uint64_t Before = HostPoolOutstanding();
    HostPoolFailAfter(Allowed);
    Failed += Catalog(nullptr) != EFI_SUCCESS;
    HostPoolFailAfter(UINT64_MAX);
    EXPECT_EQ(HostPoolOutstanding(), Before) << "catalog, allocation " << Allowed;
    HostPoolFailAfter(Allowed);
    Failed += Import(u"dir\\image.bin") != EFI_SUCCESS;
    HostPoolFailAfter(UINT64_MAX);
    EXPECT_EQ(HostPoolOutstanding(), Before) << "import, allocation " << Allowed;
  }
  EXPECT_GT(Failed, 0);
}

} // namespace
