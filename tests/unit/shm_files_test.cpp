#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Guid.h"
#include "platform/SharedMemory.h"
#include "platform/Strings.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::platform;

namespace {

std::string ShmFile(const std::string& name) { return "/dev/shm/" + name; }

// A fresh object name, removed at the end of the test whatever happened.
class ShmTest : public ::testing::Test {
protected:
    void TearDown() override {
        for (const auto& n : mNames) MemoryMappedFile::Remove(n);
    }
    std::string NewName() {
        mNames.push_back("tidelink-test-" + Guid::New().ToString());
        return mNames.back();
    }
    std::vector<std::string> mNames;
};

}  // namespace

TEST_F(ShmTest, InitCreatesPrivateObjectExclusively) {
    const std::string name = NewName();
    MemoryMappedFile creator;
    ASSERT_TRUE(creator.Init(name, 4096, 0));
    EXPECT_TRUE(creator.IsOpen());
    EXPECT_TRUE(creator.MappedMemoryIsWritable());
    EXPECT_EQ(creator.Size(), 4096u);
    EXPECT_EQ(creator.Name(), name);
    EXPECT_TRUE(MemoryMappedFile::Exists(name));
    struct stat st {};
    ASSERT_EQ(::stat(ShmFile(name).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(st.st_size, 4096);
    std::memset(creator.GetAddress(), 0x5a, 4096);

    MemoryMappedFile second;
    EXPECT_FALSE(second.Init(name, 4096, 0));
    EXPECT_EQ(second.LastError(), EEXIST);
    EXPECT_FALSE(second.IsOpen());
    // The refused second creator did not take the first one's object away.
    EXPECT_TRUE(MemoryMappedFile::Exists(name));
    EXPECT_EQ(static_cast<const uint8_t*>(creator.GetAddress())[4095], 0x5a);

    MemoryMappedFile empty;
    EXPECT_FALSE(empty.Init(NewName(), 0, 0));
}

TEST_F(ShmTest, ReplaceStaleTakesOverALeftoverObject) {
    const std::string name = NewName();
    // What a crashed creator leaves behind.
    const int fd = ::shm_open(("/" + name).c_str(), O_RDWR | O_CREAT | O_EXCL, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::ftruncate(fd, 64), 0);
    ASSERT_EQ(::write(fd, "stale", 5), 5);
    ::close(fd);

    MemoryMappedFile plain;
    EXPECT_FALSE(plain.Init(name, 128, 0));
    MemoryMappedFile replacing;
    ASSERT_TRUE(replacing.Init(name, 128, kMMFReplaceStale));
    EXPECT_EQ(replacing.Size(), 128u);
    const auto* p = static_cast<const uint8_t*>(replacing.GetAddress());
    for (size_t i = 0; i < 128; ++i) ASSERT_EQ(p[i], 0) << i;
    struct stat st {};
    ASSERT_EQ(::stat(ShmFile(name).c_str(), &st), 0);
    EXPECT_EQ(st.st_size, 128);
}

TEST_F(ShmTest, OpenChecksSizeAndAccess) {
    const std::string name = NewName();
    MemoryMappedFile creator;
    ASSERT_TRUE(creator.Init(name, 4096, 0));
    std::strcpy(static_cast<char*>(creator.GetAddress()), "from the creator");

    MemoryMappedFile tooBig;
    EXPECT_FALSE(tooBig.Open(name, 8192, 0));
    EXPECT_EQ(tooBig.LastError(), EINVAL);
    EXPECT_FALSE(tooBig.IsOpen());

    MemoryMappedFile reader;
    ASSERT_TRUE(reader.Open(name, 0, kMMFReadOnly));
    EXPECT_EQ(reader.Size(), 4096u);
    EXPECT_FALSE(reader.MappedMemoryIsWritable());
    EXPECT_STREQ(static_cast<const char*>(reader.GetAddress()), "from the creator");

    MemoryMappedFile both;
    ASSERT_TRUE(both.Open(name, 16, kMMFWritable | kMMFReadOnly));
    EXPECT_FALSE(both.MappedMemoryIsWritable());
    EXPECT_EQ(both.Size(), 16u);

    MemoryMappedFile writer;
    ASSERT_TRUE(writer.Open(name, 4096, kMMFWritable));
    EXPECT_TRUE(writer.MappedMemoryIsWritable());
    std::strcpy(static_cast<char*>(writer.GetAddress()), "from the writer");
    EXPECT_STREQ(static_cast<const char*>(creator.GetAddress()), "from the writer");
    EXPECT_STREQ(static_cast<const char*>(reader.GetAddress()), "from the writer");

    // Closing an opener does not remove the object; only its creator does.
    writer.Close();
    EXPECT_FALSE(writer.IsOpen());
    EXPECT_TRUE(MemoryMappedFile::Exists(name));

    MemoryMappedFile missing;
    EXPECT_FALSE(missing.Open(NewName(), 0, 0));
    EXPECT_EQ(missing.LastError(), ENOENT);
}

TEST_F(ShmTest, UnsafeNamesAreRefused) {
    const std::string bad[] = {"", ".", "..", "../tidelink-test-escape", "a/b", "/tidelink-test",
                               std::string("tidelink-test-\0x", 16), std::string(201, 'n')};
    for (const auto& name : bad) {
        EXPECT_FALSE(MemoryMappedFile::IsValidName(name)) << name;
        MemoryMappedFile f;
        EXPECT_FALSE(f.Init(name, 16, 0)) << name;
        EXPECT_EQ(f.LastError(), EINVAL);
        EXPECT_FALSE(f.Open(name, 0, 0)) << name;
        EXPECT_EQ(f.LastError(), EINVAL);
        EXPECT_FALSE(MemoryMappedFile::Exists(name));
        EXPECT_FALSE(MemoryMappedFile::Remove(name));
    }
    EXPECT_TRUE(MemoryMappedFile::IsValidName(std::string(200, 'n')));
}

TEST_F(ShmTest, CreatorTakesTheNameAwayButOpenMappingsStayReadable) {
    const std::string name = NewName();
    auto creator = std::make_unique<MemoryMappedFile>();
    ASSERT_TRUE(creator->Init(name, 8192, 0));
    std::memset(creator->GetAddress(), 0xa5, 8192);

    MemoryMappedFile reader;
    ASSERT_TRUE(reader.Open(name, 0, kMMFReadOnly));
    creator.reset();
    EXPECT_FALSE(MemoryMappedFile::Exists(name));
    struct stat st {};
    EXPECT_NE(::stat(ShmFile(name).c_str(), &st), 0);
    const auto* p = static_cast<const uint8_t*>(reader.GetAddress());
    EXPECT_EQ(p[0], 0xa5);
    EXPECT_EQ(p[8191], 0xa5);

    // Unlink keeps the creator's own mapping.
    MemoryMappedFile again;
    ASSERT_TRUE(again.Init(name, 16, 0));
    again.Unlink();
    EXPECT_FALSE(MemoryMappedFile::Exists(name));
    EXPECT_TRUE(again.IsOpen());
    static_cast<uint8_t*>(again.GetAddress())[15] = 1;
}

// ---- link manager discovery ----

namespace {

class ScopedEnv {
public:
    ScopedEnv(const char* name, const std::string& value) : mName(name) {
        ::setenv(name, value.c_str(), 1);
    }
    ~ScopedEnv() { ::unsetenv(mName); }
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

private:
    const char* mName;
};

void Touch(const std::string& path) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0700);
    ASSERT_GE(fd, 0) << path;
    ::close(fd);
}

std::string RealPath(const std::string& path) {
    char buf[PATH_MAX];
    return ::realpath(path.c_str(), buf) ? std::string(buf) : std::string();
}

constexpr char kProgram[] = "tidelink-test-program";

class ServerPathTest : public ::testing::Test {
protected:
    void SetUp() override {
        char base[] = "/tmp/tidelink-test-paths-XXXXXX";
        ASSERT_NE(::mkdtemp(base), nullptr);
        mBase = base;
        for (const char* d : {"/package", "/app", "/folder", "/elsewhere"}) {
            ASSERT_EQ(::mkdir((mBase + d).c_str(), 0700), 0);
        }
        mPackage.emplace("TIDELINK_PACKAGE_DIR", mBase + "/package");
        mApp.emplace("TIDELINK_APP_DIR", mBase + "/app");
    }
    void TearDown() override {
        mPackage.reset();
        mApp.reset();
        for (const char* d : {"/package/", "/app/", "/folder/", "/elsewhere/"}) {
            const std::string program = mBase + d + kProgram;
            if (::unlink(program.c_str()) != 0) ::rmdir(program.c_str());
            ::unlink((mBase + d + "target").c_str());
            ::rmdir((mBase + d).c_str());
        }
        ::rmdir(mBase.c_str());
    }
    WString Find() const {
        return GetSharedServerPath(ToUTF16(kProgram), u"", u"1.0", ToUTF16(mBase + "/folder"));
    }
    std::string In(const char* dir) const { return mBase + "/" + dir + "/" + kProgram; }

    std::string mBase;
    std::optional<ScopedEnv> mPackage;
    std::optional<ScopedEnv> mApp;
};

}  // namespace

TEST_F(ServerPathTest, PackageThenAppThenFolder) {
    Touch(In("folder"));
    EXPECT_EQ(ToUTF8(Find()), In("folder"));
    Touch(In("app"));
    EXPECT_EQ(ToUTF8(Find()), In("app"));
    Touch(In("package"));
    EXPECT_EQ(ToUTF8(Find()), In("package"));
}

TEST_F(ServerPathTest, LinkInPackageFolderIsFollowed) {
    const std::string target = mBase + "/elsewhere/target";
    Touch(target);
    Touch(In("app"));
    ASSERT_EQ(::symlink(target.c_str(), In("package").c_str()), 0);
    EXPECT_EQ(ToUTF8(Find()), RealPath(target));

    // A dangling link is passed over.
    ASSERT_EQ(::unlink(target.c_str()), 0);
    EXPECT_EQ(ToUTF8(Find()), In("app"));
}

TEST_F(ServerPathTest, NothingAnywhereThrows) {
    // A folder of that name is not a program.
    ASSERT_EQ(::mkdir(In("app").c_str(), 0700), 0);
    try {
        Find();
        ADD_FAILURE() << "no LinkError";
    } catch (const LinkError& e) {
        EXPECT_STREQ(e.what(), "Cannot find TideLink Server");
    }
    EXPECT_THROW(GetSharedServerPath(ToUTF16(kProgram), u"", u"", u""), LinkError);
}

class ManagerPortTest : public ShmTest {};

TEST_F(ManagerPortTest, ReadsTheLowSixteenBits) {
    const uint32_t pid = static_cast<uint32_t>(::getpid());
    const std::string name = GetTideLinkManagerPortFileName(pid);
    mNames.push_back(name);
    EXPECT_EQ(ReadManagerPort(pid), 0);

    auto publish = [&](uint32_t value) {
        auto file = std::make_unique<MemoryMappedFile>();
        EXPECT_TRUE(file->Init(name, 4, kMMFReplaceStale));
        auto* p = static_cast<uint8_t*>(file->GetAddress());
        for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(value >> (8 * i));
        return file;
    };
    {
        auto file = publish(0x0000C35A);
        EXPECT_EQ(ReadManagerPort(pid), 0xC35A);
    }
    {
        auto file = publish(0);
        EXPECT_EQ(ReadManagerPort(pid), 0);
    }
    {
        auto file = publish(0x0001ABCD);
        EXPECT_EQ(ReadManagerPort(pid), 0xABCD);
    }
    // A mapping too small to hold a port reads as none.
    MemoryMappedFile small;
    ASSERT_TRUE(small.Init(name, 2, 0));
    std::memset(small.GetAddress(), 0xff, 2);
    EXPECT_EQ(ReadManagerPort(pid), 0);
    small.Close();
    EXPECT_EQ(ReadManagerPort(pid), 0);
}

TEST(LinkManagerNames, CarryPidAndProtocolVersion) {
    const std::string version = CSVersionPortNumberString();
    EXPECT_EQ(GetTideLinkManagerPortFileName(1234), "tlm1234" + version);
    EXPECT_EQ(GetKeyFileName(), "com.quenlo.tidelinkmanager" + version);
    EXPECT_EQ(ToUTF8(GetTideLinkProtocolVersion()),
              std::to_string(std::get<0>(GetTideLinkVersionInfo())) + ".0");
    if (!std::getenv("TIDELINK_SUITE_VERSION") && !std::getenv("TIDELINK_BETA")) {
        EXPECT_EQ(version, "1.0");
        EXPECT_EQ(GetTideLinkManagerPortFileName(77), "tlm771.0");
    }
    EXPECT_TRUE(MemoryMappedFile::IsValidName(GetTideLinkManagerPortFileName(UINT32_MAX)));
}
