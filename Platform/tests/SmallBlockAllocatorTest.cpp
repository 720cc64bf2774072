#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <map>
#include <memory>
#include <new>
#include <vector>

using kivcore::utility::SmallBlockAllocator;

namespace {

// Restores "never fail" however a test ends.
struct FailAfterScope {
  explicit FailAfterScope(long long inCount) { SmallBlockAllocator::SetFailAfter(inCount); }
  ~FailAfterScope() { SmallBlockAllocator::SetFailAfter(-1); }
};

void ExpectBalanced(const SmallBlockAllocator::Statistics& inBefore) {
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(inBefore.blocksInUse, after.blocksInUse);
  EXPECT_EQ(inBefore.bytesInUse, after.bytesInUse);
}

// Every size class, the edges around them, zero and large sizes, and enough
// 48-byte blocks to span several pool chunks and overflow the thread cache
// when they come back. A block shorter than asked, or handed out twice,
// shows up as a damaged stamp; the statistics count exactly what was asked.
TEST(SmallBlockAllocator, BlocksOfEverySizeAreDistinctAlignedAndCountedExactly) {
  std::vector<std::size_t> sizes = {0, 0, 1, 7, 15, 16, 17, 100, 255, 256, 257, 511, 512, 513, 4096, 100000};
  sizes.insert(sizes.end(), 3000, 48);
  const auto before = SmallBlockAllocator::GetStatistics();
  std::vector<unsigned char*> blocks;
  std::size_t bytes = 0;
  for (std::size_t i = 0; i < sizes.size(); ++i) {
    auto* block = static_cast<unsigned char*>(SmallBlockAllocator::Allocate(sizes[i]));
    ASSERT_NE(nullptr, block) << sizes[i];
    ASSERT_EQ(0u, reinterpret_cast<std::uintptr_t>(block) % alignof(std::max_align_t)) << sizes[i];
    std::memset(block, static_cast<int>(i % 251), sizes[i] != 0 ? sizes[i] : 1);
    blocks.push_back(block);
    bytes += sizes[i];
  }
  const auto during = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse + sizes.size(), during.blocksInUse);
  EXPECT_EQ(before.bytesInUse + bytes, during.bytesInUse);
  EXPECT_EQ(before.allocations + sizes.size(), during.allocations);
  for (std::size_t i = 0; i < sizes.size(); ++i) {
    for (std::size_t b = 0; b < std::max<std::size_t>(sizes[i], 1); ++b)
      ASSERT_EQ(i % 251, blocks[i][b]) << "block " << i << " of " << sizes[i] << " bytes, byte " << b;
    SmallBlockAllocator::Dispose(blocks[i], sizes[i]);
  }
  SmallBlockAllocator::Dispose(nullptr, 24);
  ExpectBalanced(before);
  EXPECT_EQ(before.allocations + sizes.size(), SmallBlockAllocator::GetStatistics().allocations);
}

struct Shape : SmallBlockAllocator::Allocated<Shape> {
  virtual ~Shape() = default;
};
struct BigShape : Shape {
  char mPayload[300] = {};
};

// Fault injection: small and large requests use up the allowance alike,
// refusals are not counted, disposal goes on working, a new count replaces
// the old one and a negative one stops the failures. The adaptors turn a
// refusal into std::bad_alloc and leave their container as it was.
TEST(SmallBlockAllocator, FailAfterRefusesAllocationsOnceTheAllowanceIsUsedUp) {
  std::vector<int, SmallBlockAllocator::STLAllocator<int>> numbers{1, 2, 3};
  const auto before = SmallBlockAllocator::GetStatistics();
  {
    FailAfterScope failAfter(2);
    void* small = SmallBlockAllocator::Allocate(16);
    void* large = SmallBlockAllocator::Allocate(2000);
    ASSERT_TRUE(small != nullptr && large != nullptr);
    for (std::size_t size : {16u, 2000u, 0u}) EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(size)) << size;
    EXPECT_EQ(before.allocations + 2, SmallBlockAllocator::GetStatistics().allocations);
    SmallBlockAllocator::Dispose(small, 16);
    SmallBlockAllocator::Dispose(large, 2000);
    EXPECT_THROW(numbers.reserve(100), std::bad_alloc);
    EXPECT_THROW(delete new BigShape, std::bad_alloc);
    SmallBlockAllocator::SetFailAfter(1);
    void* last = SmallBlockAllocator::Allocate(8);
    EXPECT_NE(nullptr, last);
    EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(8));
    SmallBlockAllocator::Dispose(last, 8);
  }
  EXPECT_EQ((std::vector<int, SmallBlockAllocator::STLAllocator<int>>{1, 2, 3}), numbers);
  EXPECT_THROW(SmallBlockAllocator::STLAllocator<std::uint64_t>().allocate(static_cast<std::size_t>(-1) / 4),
               std::bad_alloc);
  void* afterwards = SmallBlockAllocator::Allocate(16);
  EXPECT_NE(nullptr, afterwards);
  SmallBlockAllocator::Dispose(afterwards, 16);
  ExpectBalanced(before);
}

// The sized delete of the mix-in gets the complete object's size, so a
// delete through the base returns the block it came from; containers give
// back every block they took.
TEST(SmallBlockAllocator, AdaptorsReturnExactlyTheBlocksTheyTook) {
  const auto before = SmallBlockAllocator::GetStatistics();
  {
    std::unique_ptr<Shape> big(new BigShape);
    std::unique_ptr<Shape> plain(new Shape);
    EXPECT_EQ(before.bytesInUse + sizeof(BigShape) + sizeof(Shape), SmallBlockAllocator::GetStatistics().bytesInUse);
    std::map<int, int, std::less<int>, SmallBlockAllocator::STLAllocator<std::pair<const int, int>>> squares;
    for (int i = 0; i < 200; ++i) squares[i] = i * i;
    for (int i = 0; i < 200; ++i) ASSERT_EQ(i * i, squares.at(i));
    EXPECT_EQ(before.blocksInUse + 202, SmallBlockAllocator::GetStatistics().blocksInUse);
  }
  ExpectBalanced(before);
}

}  // namespace
