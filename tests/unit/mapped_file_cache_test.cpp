// The process-wide cache of open mappings and its limits.
#include <gtest/gtest.h>
#include <unistd.h>

#include "platform/SharedMemory.h"
#include "processcoordination/ProcessCoordination.h"

using namespace processcoordination;
using tidelink::platform::MemoryMappedFile;

namespace {

class MappedFileCacheTest : public ::testing::Test {
protected:
    void SetUp() override { ClearMappedFileCache(); }
    void TearDown() override {
        ClearMappedFileCache();
        mObjects.clear();
    }
    std::string Make(uint64_t size) {
        const std::string name = "tidelink-test-" + std::to_string(::getpid()) + "-" + std::to_string(mObjects.size());
        auto m = std::make_unique<MemoryMappedFile>();
        EXPECT_TRUE(m->Init(name, size, 0));
        mObjects.push_back(std::move(m));
        return name;
    }
    std::vector<std::unique_ptr<MemoryMappedFile>> mObjects;
};

TEST_F(MappedFileCacheTest, ReturnedMappingIsHandedBackOnlyForTheSameSize) {
    const std::string name = Make(200000);
    auto first = GetCachedMemoryMappedFile(name, 200000, true);
    ASSERT_TRUE(first);
    void* address = first->GetAddress();
    static_cast<char*>(address)[0] = 42;
    ReturnCachedMemoryMappedFile(name, std::move(first));
    EXPECT_EQ(GetMappedFileCacheStats().entries, 1u);
    auto again = GetCachedMemoryMappedFile(name, 200000, true);
    ASSERT_TRUE(again);
    EXPECT_EQ(again->GetAddress(), address);
    ReturnCachedMemoryMappedFile(name, std::move(again));
    // Another size of the same name discards the cached mapping and maps anew.
    auto smaller = GetCachedMemoryMappedFile(name, 150000, true);
    ASSERT_TRUE(smaller);
    EXPECT_EQ(smaller->Size(), 150000u);
    EXPECT_EQ(GetMappedFileCacheStats().entries, 0u);
    // An object shorter than asked is never mapped (reading past its end would fault).
    EXPECT_FALSE(GetCachedMemoryMappedFile(name, 200001, true));
    EXPECT_FALSE(GetCachedMemoryMappedFile("tidelink-test-missing", 200000, true));
}

TEST_F(MappedFileCacheTest, SizeBoundsAndEviction) {
    const std::string tooSmall = Make(99999), smallest = Make(100000), tooBig = Make(33177601);
    for (const auto& [name, size] : {std::pair{tooSmall, 99999ull}, {smallest, 100000ull}, {tooBig, 33177601ull}}) {
        ReturnCachedMemoryMappedFile(name, GetCachedMemoryMappedFile(name, size, true));
    }
    EXPECT_EQ(GetMappedFileCacheStats().entries, 1u) << "only the 100,000-byte mapping is kept";

    // A 101st entry evicts the oldest.
    ClearMappedFileCache();
    std::vector<std::string> names;
    for (int i = 0; i < 101; ++i) names.push_back(Make(100000));
    for (const auto& n : names) ReturnCachedMemoryMappedFile(n, GetCachedMemoryMappedFile(n, 100000, true));
    EXPECT_EQ(GetMappedFileCacheStats().entries, 100u);
    const auto created = GetMappedFileCacheStats().mappingsCreated;
    auto newest = GetCachedMemoryMappedFile(names.back(), 100000, true);
    auto oldest = GetCachedMemoryMappedFile(names.front(), 100000, true);
    EXPECT_EQ(GetMappedFileCacheStats().mappingsCreated, created + 1) << "the oldest was evicted";

    // The byte total: two 13,107,201-byte mappings exceed 26,214,400, so the older goes.
    ClearMappedFileCache();
    const std::string a = Make(13107201), b = Make(13107201);
    ReturnCachedMemoryMappedFile(a, GetCachedMemoryMappedFile(a, 13107201, true));
    ReturnCachedMemoryMappedFile(b, GetCachedMemoryMappedFile(b, 13107201, true));
    EXPECT_EQ(GetMappedFileCacheStats().entries, 1u);
    EXPECT_EQ(GetMappedFileCacheStats().bytes, 13107201u);
}

TEST(CoordinationWithoutClient, EveryCallAnswersNoClient) {
    const Guid id = Guid::New();
    BinaryReferencePtr r;
    WritableBinaryReferencePtr w;
    EXPECT_EQ(IsBinaryDataCurrentlyAvailable(id), -5);
    EXPECT_EQ(GetBinaryDataIfAvailable(id, r), -5);
    EXPECT_EQ(GetBinaryDataWithAsyncNotification(id, [](const Guid&, BinaryReferencePtr, int) {}), -5);
    EXPECT_EQ(GetWritableBinaryData(10, w), -5);
    EXPECT_EQ(BeginBinaryDataGeneration(id, false), -5);
    EXPECT_EQ(PutBinaryDataGenerationError(id, -6), -5);
    EXPECT_FALSE(GetDeliveryExecutor());
}

}  // namespace
