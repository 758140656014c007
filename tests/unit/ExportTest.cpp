// The export side: the source-type classification, the destination on the
// share, the three export tasks against the stand-in share, and the two
// readers the exported names come from (SMBIOS asset tag, sysInfo.xml), fed
// with malformed input.
#include "ExportToNWFS/ExportTasks.h"
#include "MockSmbServer.h"
#include "NwFsDrv.h"
#include "ShareStandIn.h"
#include "Tasks.h"

#include <regex>

namespace {

namespace fs = std::filesystem;

constexpr const char *kSysInfo = "<SystemInfo>\n"
                                 "  <ServiceTag>7XK4Q2R</ServiceTag>\n"
                                 "  <TimeStamp>2024-02-29T23:05:09</TimeStamp>\n"
                                 "</SystemInfo>\n";

class ExportTest : public ShareTaskTest {
protected:
  EFI_STATUS Export(const CHAR16 *SourceType, const CHAR16 *FileName = nullptr,
                    UINT32 ShareType = NWFS_SHARE_TYPE_CIFS, std::string *Out = nullptr) {
    return Captured(Out,
                    [&] { return ExporttoNWShare(ShareType, FileName, u"Export", SourceType); });
  }

  // Names of the files in a directory of the share.
  std::vector<std::string> SharedFiles(const std::string &Directory = "") const {
    std::vector<std::string> Names;
    for (const auto &Entry : fs::directory_iterator(ShareDir + "/" + Directory)) {
      if (Entry.is_regular_file()) {
        Names.push_back(Entry.path().filename().string());
      }
    }
    std::sort(Names.begin(), Names.end());
    return Names;
  }
};

// ---------------------------------------------------------------------------
// Classification and destination
// ---------------------------------------------------------------------------

// The types' own names export in the tests below and the e2e scripts; here
// the names next to them.
TEST_F(ExportTest, SourceTypesAreClassifiedWholeExceptTheReportPrefix) {
  for (const CHAR16 *Type : {u"dgr", u"VMLx", u"VM", u"", static_cast<const CHAR16 *>(nullptr)}) {
    EXPECT_EQ(ClassifyExportSource(Type), EXPORT_KIND_NONE) << HostUcs2ToUtf8(Type);
  }
  EXPECT_EQ(ClassifyExportSource(u"DGRxyz"), EXPORT_KIND_TECH_SUPPORT);
}

TEST_F(ExportTest, ShareWithoutDriveNameIsNotFound) {
  Share.Uninstall();
  fs::create_directories(RamfsDir);
  std::ofstream(RamfsDir + "/VelmorLog.xml") << "<log/>";
  std::string Out;
  EXPECT_EQ(Export(u"VML", nullptr, NWFS_SHARE_TYPE_CIFS, &Out), EFI_NOT_FOUND);
  EXPECT_NE(Out.find("Drive name not found!\n"), std::string::npos);
  ExpectNoPoolLeak();
}

// ---------------------------------------------------------------------------
// Log and inventories
// ---------------------------------------------------------------------------

TEST_F(ExportTest, CompressedLogIsTakenWhenThePlainOneIsAbsent) {
  WriteFile(RamfsDir + "/VelmorLog.xml.gz", "gz");
  HostSetSmbiosAssetTag(nullptr); // no SMBIOS table at all
  std::string Out;
  EXPECT_EQ(Export(u"VML", nullptr, NWFS_SHARE_TYPE_CIFS, &Out), EFI_SUCCESS) << Out;
  std::vector<std::string> Names = SharedFiles();
  ASSERT_EQ(Names.size(), 1u);
  EXPECT_TRUE(std::regex_match(Names[0], std::regex(R"(NoAssetTag_VelmorLog_D.*_T.*\.xml\.gz)")))
      << Names[0];
  EXPECT_NE(Out.find("DestPath CIFS:\\ \n"), std::string::npos);
  ExpectNoPoolLeak();
}

// ---------------------------------------------------------------------------
// Backup image and technical-support report
// ---------------------------------------------------------------------------

TEST_F(ExportTest, BackupImageOnNfsGoesToTheRootWhateverTheName) {
  Share.Uninstall();
  Console([&] { Share.Install(u"share", u"NFS"); });
  PoolAtStart = HostPoolOutstanding();
  WriteFile(RamfsDir + "/backup.img", "image bytes");
  WriteFile(RamfsDir + "/sysInfo.xml", kSysInfo);
  std::string Out;
  EXPECT_EQ(Export(u"BKP", u"ignored", NWFS_SHARE_TYPE_NFS, &Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(SharedFiles(), std::vector<std::string>{"7XK4Q2R_Backup_D2024-02-29_T23-05-09.img"});
  EXPECT_EQ(ReadFile(ShareDir + "/7XK4Q2R_Backup_D2024-02-29_T23-05-09.img"), "image bytes");
  EXPECT_NE(Out.find("DestPath NFS:\\ \n"), std::string::npos);
  ExpectNoPoolLeak();
}

TEST_F(ExportTest, BackupImageWithUnusableSysInfoIsNotExported) {
  WriteFile(RamfsDir + "/backup.img", "image bytes");
  const char *Broken[] = {
      "<ServiceTag>7XK 4Q2R</ServiceTag><TimeStamp>2024-02-29T23:05:09</TimeStamp>",
      "<ServiceTag>7XK4Q2R</ServiceTag><TimeStamp>2023-02-29T23:05:09</TimeStamp>",
      "<ServiceTag>7XK4Q2R</ServiceTag>",
      "",
  };
  for (const char *Text : Broken) {
    SCOPED_TRACE(Text);
    WriteFile(RamfsDir + "/sysInfo.xml", Text);
    std::string Out;
    EXPECT_TRUE(EFI_ERROR(Export(u"BKP", nullptr, NWFS_SHARE_TYPE_CIFS, &Out)));
    EXPECT_NE(Out.find("Reading the service tag and time stamp failed!"), std::string::npos);
    EXPECT_TRUE(SharedFiles().empty());
    ExpectNoPoolLeak();
  }
}

TEST_F(ExportTest, TechnicalSupportReportExportsEveryFileUnderItsName) {
  fs::create_directories(ShareDir + "/case42");
  WriteFile(RamfsDir + "/TSReport/b-hw.txt", "hardware");
  WriteFile(RamfsDir + "/TSReport/a-sys.log", "system");
  WriteFile(RamfsDir + "/TSReport/bad name.txt", "left out");
  fs::create_directories(RamfsDir + "/TSReport/sub");
  std::string Out;
  EXPECT_EQ(Export(u"DGRxyz", u"case42", NWFS_SHARE_TYPE_CIFS, &Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(SharedFiles("case42"), (std::vector<std::string>{"a-sys.log", "b-hw.txt"}));
  EXPECT_EQ(ReadFile(ShareDir + "/case42/b-hw.txt"), "hardware");
  // In name order, each with the log redirected into ramfs:.
  size_t First = Out.find("command = [cp -q ramfs:\\TSReport\\a-sys.log CIFS:\\case42\\ > "
                          "ramfs:\\DGRLog.txt]");
  size_t Second = Out.find("command = [cp -q ramfs:\\TSReport\\b-hw.txt CIFS:\\case42\\ > "
                           "ramfs:\\DGRLog.txt]");
  EXPECT_NE(First, std::string::npos) << Out;
  EXPECT_NE(Second, std::string::npos);
  EXPECT_LT(First, Second);
  EXPECT_NE(Out.find("Report file bad name.txt has an unusable name, left out"), std::string::npos);
  EXPECT_TRUE(fs::exists(RamfsDir + "/DGRLog.txt"));
  ExpectNoPoolLeak();
}

// ---------------------------------------------------------------------------
// The readers, fed with malformed input in buffers of exactly its length
// ---------------------------------------------------------------------------

// An SMBIOS structure: type, formatted length, the formatted bytes after the
// header, then the strings and the closing NUL.
std::vector<UINT8> Structure(UINT8 Type, std::vector<UINT8> Formatted,
                             std::vector<std::string> Strings) {
  std::vector<UINT8> Out = {Type, static_cast<UINT8>(4 + Formatted.size()), 0x00, 0x01};
  Out.insert(Out.end(), Formatted.begin(), Formatted.end());
  for (const std::string &S : Strings) {
    Out.insert(Out.end(), S.begin(), S.end());
    Out.push_back(0);
  }
  if (Strings.empty()) {
    Out.push_back(0);
  }
  Out.push_back(0);
  return Out;
}

// A chassis record (manufacturer, rack mount) whose asset tag is string
// AssetString.
std::vector<UINT8> Chassis(UINT8 AssetString, std::vector<std::string> Strings) {
  std::vector<UINT8> Formatted(0x15 - 4, 0);
  Formatted[0] = 1;
  Formatted[1] = 0x17;
  Formatted[8 - 4] = AssetString;
  return Structure(3, Formatted, Strings);
}

TEST_F(ExportTest, MalformedSmbiosTablesAreRejectedWithinTheirBounds) {
  std::vector<UINT8> Good = Chassis(1, {"TAG1"});
  std::vector<UINT8> ZeroLength = Good, PastEnd = Good;
  ZeroLength[1] = 0;
  PastEnd[1] = 0xF0;
  const struct {
    const char *Name;
    std::vector<UINT8> Table;
    EFI_STATUS Expected;
  } Cases[] = {
      {"length below the header", ZeroLength, EFI_COMPROMISED_DATA},
      {"length past the table", PastEnd, EFI_COMPROMISED_DATA},
      {"strings without their end", {Good.begin(), Good.end() - 2}, EFI_COMPROMISED_DATA},
      {"table cut inside the header", {Good.begin(), Good.begin() + 3}, EFI_NOT_FOUND},
      {"asset tag string beyond the set", Chassis(4, {"a", "b"}), EFI_NOT_FOUND},
      {"no asset tag string", Chassis(0, {"a"}), EFI_NOT_FOUND},
      {"blank asset tag", Chassis(1, {"   "}), EFI_NOT_FOUND},
      {"short chassis record", Structure(3, {1, 2, 3}, {"x"}), EFI_NOT_FOUND},
      {"end of table first", MockSmb::Concat({Structure(127, {}, {}), Good}), EFI_NOT_FOUND},
      {"no chassis record", Structure(1, {1, 2, 3, 4}, {"sys"}), EFI_NOT_FOUND},
  };
  for (const auto &C : Cases) {
    std::vector<UINT8> Exact(C.Table.begin(), C.Table.end()); // any read past it is seen
    CHAR8 Tag[EXPORT_TAG_CHARS];
    EXPECT_EQ(SmbiosFindChassisAssetTag(Exact.data(), Exact.size(), Tag, sizeof(Tag)), C.Expected)
        << C.Name;
  }
}

TEST_F(ExportTest, ElementReaderAcceptsOnlyTheOnePlainElement) {
  const struct {
    std::string Text;
    EFI_STATUS Status;
    const char *Value;
  } Cases[] = {
      {"<a><Tag>V1</Tag></a>", EFI_SUCCESS, "V1"},
      {"<TagX>no</TagX><Tag>yes</Tag>", EFI_SUCCESS, "yes"},
      {"<Tags>no</Tags>", EFI_NOT_FOUND, ""},
      {"<Tag>a</Tag><Tag>b</Tag>", EFI_INVALID_PARAMETER, ""},
      {"<Tag id=\"1\">a</Tag>", EFI_INVALID_PARAMETER, ""},
      {"<Tag></Tag>", EFI_INVALID_PARAMETER, ""},
      {"<Tag>a<b/></Tag>", EFI_INVALID_PARAMETER, ""},
      {"<Tag>a</Ta", EFI_INVALID_PARAMETER, ""},
      {"<Tag>a</TagX>", EFI_INVALID_PARAMETER, ""},
      {"<Tag>abc", EFI_INVALID_PARAMETER, ""},
      {"<Tag", EFI_NOT_FOUND, ""},
      {std::string("<Tag>a\0b</Tag>", 14), EFI_INVALID_PARAMETER, ""},
      {"<Tag>" + std::string(31, 'x') + "</Tag>", EFI_SUCCESS, nullptr},
      {"<Tag>" + std::string(32, 'x') + "</Tag>", EFI_BUFFER_TOO_SMALL, ""},
  };
  for (const auto &C : Cases) {
    std::vector<CHAR8> Exact(C.Text.begin(), C.Text.end()), Value(32);
    EXPECT_EQ(Quiet([&] {
                return XmlReadElement(Exact.data(), Exact.size(), "Tag", Value.data(),
                                      Value.size());
              }),
              C.Status)
        << C.Text;
    EXPECT_EQ(Value.data(), C.Value != nullptr ? C.Value : std::string(31, 'x')) << C.Text;
  }
}

TEST_F(ExportTest, TimeStampsMustBeRealTimes) {
  EFI_TIME Time = {};
  ASSERT_EQ(ParseXmlTimeStamp("2024-02-29T23:59:59", &Time), EFI_SUCCESS);
  EXPECT_EQ(
      std::vector<int>({Time.Year, Time.Month, Time.Day, Time.Hour, Time.Minute, Time.Second}),
      std::vector<int>({2024, 2, 29, 23, 59, 59}));
  EXPECT_EQ(ParseXmlTimeStamp("2000-02-29T00:00:00", &Time), EFI_SUCCESS);
  for (const char *Bad :
       {"1900-02-29T00:00:00", "2023-02-29T00:00:00", "2024-04-31T00:00:00", "2024-13-01T00:00:00",
        "2024-00-10T00:00:00", "2024-01-01T24:00:00", "2024-01-01T00:60:00", "2024-01-01T00:00:60",
        "2024-01-01 00:00:00", "2024-1-01T00:00:00", "2024-01-01T00:00:0", "2024-01-01T00:00:000",
        "+024-01-01T00:00:00", "1899-12-31T00:00:00"}) {
    EXPECT_EQ(ParseXmlTimeStamp(Bad, &Time), EFI_INVALID_PARAMETER) << Bad;
  }
}

} // namespace
