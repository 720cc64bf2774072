#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <list>
#include <map>
#include <memory>
#include <new>
#include <string>
#include <vector>

using kivcore::utility::SmallBlockAllocator;

namespace {

// Restores "never fail" however a test ends.
struct FailAfterScope {
  explicit FailAfterScope(long long inCount) { SmallBlockAllocator::SetFailAfter(inCount); }
  ~FailAfterScope() { SmallBlockAllocator::SetFailAfter(-1); }
};

bool IsAligned(const void* inBlock) {
  return reinterpret_cast<std::uintptr_t>(inBlock) % alignof(std::max_align_t) == 0;
}

const std::size_t kSizes[] = {1, 2, 7, 8, 15, 16, 17, 31, 32, 33, 48, 63, 64, 100, 127, 128, 129,
                              255, 256, 257, 384, 511, 512, 513, 600, 1024, 4096, 100000};

TEST(SmallBlockAllocatorBlocks, EverySizeRoundTripsWithItsContentsIntactAndAligned) {
  const auto before = SmallBlockAllocator::GetStatistics();
  std::vector<std::pair<unsigned char*, std::size_t>> blocks;
  for (int round = 0; round < 3; ++round) {
    for (std::size_t size : kSizes) {
      auto* block = static_cast<unsigned char*>(SmallBlockAllocator::Allocate(size));
      ASSERT_NE(nullptr, block) << size;
      EXPECT_TRUE(IsAligned(block)) << size;
      std::memset(block, static_cast<int>(blocks.size() % 251), size);
      blocks.emplace_back(block, size);
    }
  }
  // Every byte of every block still holds its own pattern: no two live
  // blocks overlap and no block is shorter than asked.
  for (std::size_t i = 0; i < blocks.size(); ++i) {
    const auto [block, size] = blocks[i];
    for (std::size_t b = 0; b < size; ++b) ASSERT_EQ(i % 251, block[b]) << "block " << i << " byte " << b;
  }
  for (const auto& [block, size] : blocks) SmallBlockAllocator::Dispose(block, size);
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
  EXPECT_EQ(before.allocations + blocks.size(), after.allocations);
}

TEST(SmallBlockAllocatorBlocks, ManyBlocksOfOneSizeSpanSeveralChunksWithoutOverlap) {
  constexpr int kCount = 20000;  // far more than one chunk of 48-byte blocks
  std::vector<std::uint32_t*> blocks;
  blocks.reserve(kCount);
  for (int i = 0; i < kCount; ++i) {
    auto* block = static_cast<std::uint32_t*>(SmallBlockAllocator::Allocate(48));
    ASSERT_NE(nullptr, block);
    for (int w = 0; w < 12; ++w) block[w] = static_cast<std::uint32_t>(i);
    blocks.push_back(block);
  }
  for (int i = 0; i < kCount; ++i)
    for (int w = 0; w < 12; ++w) ASSERT_EQ(static_cast<std::uint32_t>(i), blocks[i][w]);
  for (std::uint32_t* block : blocks) SmallBlockAllocator::Dispose(block, 48);
}

TEST(SmallBlockAllocatorBlocks, ZeroBytesGivesADistinctBlock) {
  const auto before = SmallBlockAllocator::GetStatistics();
  void* a = SmallBlockAllocator::Allocate(0);
  void* b = SmallBlockAllocator::Allocate(0);
  ASSERT_NE(nullptr, a);
  ASSERT_NE(nullptr, b);
  EXPECT_NE(a, b);
  EXPECT_EQ(before.blocksInUse + 2, SmallBlockAllocator::GetStatistics().blocksInUse);
  SmallBlockAllocator::Dispose(a, 0);
  SmallBlockAllocator::Dispose(b, 0);
  EXPECT_EQ(before.blocksInUse, SmallBlockAllocator::GetStatistics().blocksInUse);
  EXPECT_EQ(before.bytesInUse, SmallBlockAllocator::GetStatistics().bytesInUse);
}

TEST(SmallBlockAllocatorBlocks, DisposingNullChangesNothing) {
  const auto before = SmallBlockAllocator::GetStatistics();
  SmallBlockAllocator::Dispose(nullptr, 24);
  SmallBlockAllocator::Dispose(nullptr, 5000);
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

TEST(SmallBlockAllocatorStatistics, CountRequestedSizesOfSmallAndLargeBlocks) {
  const auto before = SmallBlockAllocator::GetStatistics();
  void* small = SmallBlockAllocator::Allocate(24);
  void* large = SmallBlockAllocator::Allocate(1000);
  auto during = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse + 2, during.blocksInUse);
  EXPECT_EQ(before.bytesInUse + 1024, during.bytesInUse);
  EXPECT_EQ(before.allocations + 2, during.allocations);

  SmallBlockAllocator::Dispose(large, 1000);
  during = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse + 1, during.blocksInUse);
  EXPECT_EQ(before.bytesInUse + 24, during.bytesInUse);

  SmallBlockAllocator::Dispose(small, 24);
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
  EXPECT_EQ(before.allocations + 2, after.allocations) << "disposing is not an allocation";
}

TEST(SmallBlockAllocatorFailAfter, GivesTheAllowedNumberOfBlocksThenNull) {
  std::vector<std::pair<void*, std::size_t>> granted;
  const auto before = SmallBlockAllocator::GetStatistics();
  {
    FailAfterScope failAfter(3);
    // Small and large requests both consume the allowance.
    for (std::size_t size : {16u, 2000u, 40u}) {
      void* block = SmallBlockAllocator::Allocate(size);
      ASSERT_NE(nullptr, block) << size;
      granted.emplace_back(block, size);
    }
    for (std::size_t size : {16u, 16u, 2000u, 0u}) EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(size)) << size;
    // Refused requests are not counted.
    const auto during = SmallBlockAllocator::GetStatistics();
    EXPECT_EQ(before.allocations + 3, during.allocations);
    EXPECT_EQ(before.blocksInUse + 3, during.blocksInUse);
    // Disposal keeps working while allocation fails.
    for (const auto& [block, size] : granted) SmallBlockAllocator::Dispose(block, size);
  }
  void* afterwards = SmallBlockAllocator::Allocate(16);
  EXPECT_NE(nullptr, afterwards) << "a negative count must stop the failures";
  SmallBlockAllocator::Dispose(afterwards, 16);
  EXPECT_EQ(before.blocksInUse, SmallBlockAllocator::GetStatistics().blocksInUse);
}

TEST(SmallBlockAllocatorFailAfter, ZeroFailsTheVeryNextAllocation) {
  FailAfterScope failAfter(0);
  EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(8));
}

TEST(SmallBlockAllocatorFailAfter, ANewCountReplacesTheRemainingOne) {
  FailAfterScope failAfter(0);
  EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(8));
  SmallBlockAllocator::SetFailAfter(1);
  void* block = SmallBlockAllocator::Allocate(8);
  EXPECT_NE(nullptr, block);
  EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(8));
  SmallBlockAllocator::Dispose(block, 8);
}

TEST(SmallBlockAllocatorAdaptors, ContainersReturnEveryBlock) {
  const auto before = SmallBlockAllocator::GetStatistics();
  {
    std::vector<int, SmallBlockAllocator::STLAllocator<int>> numbers;
    for (int i = 0; i < 1000; ++i) numbers.push_back(i);
    std::list<std::string, SmallBlockAllocator::STLAllocator<std::string>> texts(50, "text");
    std::map<int, int, std::less<int>, SmallBlockAllocator::STLAllocator<std::pair<const int, int>>> map;
    for (int i = 0; i < 200; ++i) map[i] = i * i;
    for (int i = 0; i < 1000; ++i) ASSERT_EQ(i, numbers[i]);
    for (const std::string& text : texts) ASSERT_EQ("text", text);
    for (int i = 0; i < 200; ++i) ASSERT_EQ(i * i, map.at(i));
    EXPECT_GT(SmallBlockAllocator::GetStatistics().blocksInUse, before.blocksInUse + 250);
  }
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

TEST(SmallBlockAllocatorAdaptors, ContainerAllocationThrowsBadAllocWhenBlocksRunOut) {
  std::vector<int, SmallBlockAllocator::STLAllocator<int>> numbers{1, 2, 3};
  using Text = std::basic_string<char, std::char_traits<char>, SmallBlockAllocator::STLAllocator<char>>;
  const auto before = SmallBlockAllocator::GetStatistics();
  {
    FailAfterScope failAfter(0);
    EXPECT_THROW(numbers.reserve(100), std::bad_alloc);
    EXPECT_THROW(Text(100, 'x'), std::bad_alloc);
  }
  // The failed growth left the container as it was.
  EXPECT_EQ(3u, numbers.size());
  EXPECT_EQ(3, numbers[2]);
  EXPECT_EQ(before.blocksInUse, SmallBlockAllocator::GetStatistics().blocksInUse);
}

TEST(SmallBlockAllocatorAdaptors, AnImpossibleElementCountThrowsBadAlloc) {
  SmallBlockAllocator::STLAllocator<std::uint64_t> allocator;
  EXPECT_THROW(allocator.allocate(static_cast<std::size_t>(-1) / 4), std::bad_alloc);
}

struct Shape : SmallBlockAllocator::Allocated<Shape> {
  virtual ~Shape() = default;
  int mSides = 0;
};

struct BigShape : Shape {
  char mPayload[300] = {};
};

struct HugeShape : Shape {
  char mPayload[5000] = {};
};

TEST(SmallBlockAllocatorAdaptors, DeletingADerivedObjectThroughItsBaseReturnsTheExactBlock) {
  const auto before = SmallBlockAllocator::GetStatistics();
  std::unique_ptr<Shape> big(new BigShape);
  std::unique_ptr<Shape> huge(new HugeShape);
  std::unique_ptr<Shape> plain(new Shape);
  EXPECT_EQ(before.bytesInUse + sizeof(BigShape) + sizeof(HugeShape) + sizeof(Shape),
            SmallBlockAllocator::GetStatistics().bytesInUse);
  big.reset();
  EXPECT_EQ(before.bytesInUse + sizeof(HugeShape) + sizeof(Shape), SmallBlockAllocator::GetStatistics().bytesInUse);
  huge.reset();
  plain.reset();
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

TEST(SmallBlockAllocatorAdaptors, AllocatedNewThrowsBadAllocWhenBlocksRunOut) {
  FailAfterScope failAfter(0);
  EXPECT_THROW(delete new BigShape, std::bad_alloc);
}

}  // namespace
