// Seeded random sequences of posts of every kind (plain, coalesced under a
// type or a caller key, cancellable under one of two tokens, idle-time), made
// on the main thread or a worker, mixed with cancels on either thread,
// flushes, idle broadcasts on a stopped or running idle station, and restarts
// of the library; checked after every step against a model of what each
// listener has heard and of how many copies are still alive.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <algorithm>
#include <random>

namespace {

using namespace messaging_test;
using namespace Tarn::StationUtils;

enum Kind { kPlain, kCoalesced, kCancellable, kIdleTime };
struct Post {
  int mValue, mStation, mKind, mKey;  // mKey: the coalescing key (-1: the type's) or the token
};

std::size_t BlocksInUse() { return kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse; }

TEST(PostKindsModelTest, EveryKindOfPostDeliversAndFreesWhatTheModelSays) {
  const ImmutableString* stations[] = {&Tarn::kStation_StatusBar, &Tarn::kStation_Repeat};
  const std::size_t before = BlocksInUse();
  for (unsigned seed = 1; seed <= 40; ++seed) {
    std::mt19937 random(seed);
    const auto pick = [&random](int inBound) { return std::uniform_int_distribution<int>(0, inBound - 1)(random); };
    CallLog log;
    RecordingListener listeners[] = {RecordingListener("s0", &log), RecordingListener("s1", &log), RecordingListener("idle", &log)};
    std::size_t base = 0;
    const auto start = [&] {
      Tarn::Messaging::Initialize();
      for (int s = 0; s < 3; ++s) AddListener(s < 2 ? *stations[s] : Tarn::kStation_Idle, &listeners[s]);
      base = BlocksInUse();
    };
    start();
    std::vector<Post> queued, idle;
    std::vector<std::string> heard;
    Tarn::PostCancelToken tokens[2];
    bool cancelled[2] = {false, false}, idleStopped = false;
    const auto hear = [&](const Post& inPost) { heard.push_back("s" + std::to_string(inPost.mStation) + ":" + std::to_string(inPost.mValue)); };
    for (int step = 0; step < 120; ++step) {
      const Post post{step, pick(2), pick(4), pick(3) - 1};
      const auto onSomeThread = [&](const std::function<void()>& inCall) { pick(2) == 0 ? inCall() : std::thread(inCall).join(); };
      switch (pick(9)) {
        case 0: case 1: case 2: case 3: {
          const NumberMessage message(post.mValue);
          const ImmutableString& station = *stations[post.mStation];
          const int token = post.mKey & 1;
          if (post.mKind == kPlain) onSomeThread([&] { PostMessageToUIThread(station, message, true); });
          if (post.mKind == kCoalesced) onSomeThread([&] { post.mKey < 0 ? PostCoalescedMessageToUIThread(station, message) : PostCoalescedMessageToUIThread(station, message, static_cast<std::uint64_t>(post.mKey)); });
          if (post.mKind == kCancellable) onSomeThread([&] { PostMessageToUIThread(station, message, tokens[token]); });
          if (post.mKind == kIdleTime) onSomeThread([&] { PostMessageAtIdleTime(station, message); });
          const auto same = std::find_if(queued.begin(), queued.end(), [&](const Post& inQueued) { return inQueued.mKind == kCoalesced && inQueued.mStation == post.mStation && inQueued.mKey == post.mKey; });
          if (post.mKind == kCoalesced && same != queued.end()) same->mValue = post.mValue;
          else if (post.mKind == kIdleTime) idle.push_back(post);
          else if (post.mKind != kCancellable || !cancelled[token]) queued.push_back(Post{post.mValue, post.mStation, post.mKind, post.mKind == kCancellable ? token : post.mKey});
          break;
        }
        case 4: {
          const int token = pick(2);
          onSomeThread([&] { tokens[token].Cancel(); });
          cancelled[token] = true;
          queued.erase(std::remove_if(queued.begin(), queued.end(), [token](const Post& inQueued) { return inQueued.mKind == kCancellable && inQueued.mKey == token; }), queued.end());
          if (pick(2) == 0) tokens[token] = Tarn::PostCancelToken(), cancelled[token] = false;
          break;
        }
        case 5:
          FlushPostedMessagesOnUIThread();
          std::for_each(queued.begin(), queued.end(), hear);
          queued.clear();
          break;
        case 6:
          BroadcastMessage(Tarn::kStation_Idle, PingMessage());
          if (idleStopped) break;
          std::for_each(idle.begin(), idle.end(), hear);
          idle.clear();
          heard.push_back("idle:ping");
          break;
        case 7:
          (idleStopped = !idleStopped) ? StopBroadcasting(Tarn::kStation_Idle) : StartBroadcasting(Tarn::kStation_Idle);
          break;
        case 8:
          if (pick(4) != 0) break;
          Tarn::Messaging::Terminate();  // the queued posts find no station; the idle-time ones are dropped
          ASSERT_EQ(before, BlocksInUse()) << "seed " << seed << " step " << step << ": a copy outlived Terminate";
          queued.clear(), idle.clear(), idleStopped = false;
          start();
          break;
      }
      ASSERT_EQ(heard, log.Entries()) << "seed " << seed << " step " << step;
      ASSERT_EQ(base + queued.size() + idle.size(), BlocksInUse()) << "seed " << seed << " step " << step << ": copies alive";
    }
    Tarn::Messaging::Terminate();
    ASSERT_EQ(before, BlocksInUse()) << "seed " << seed;
  }
}

}  // namespace
