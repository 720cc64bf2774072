#include "DemoOptions.h"

#include <cerrno>
#include <cstdlib>
#include <thread>

namespace tarn_demo {

namespace {

constexpr std::uint32_t kMaxWorkers = 256;
constexpr std::uint64_t kMaxMessages = 100000000;
constexpr std::uint32_t kMaxIdleMilliSeconds = 10000;
constexpr std::uint32_t kMaxTraceSlowMilliSeconds = 60000;

// A whole decimal number in [inMin, inMax]; no sign, no trailing characters.
bool ParseCount(const char* inText, std::uint64_t inMin, std::uint64_t inMax, std::uint64_t& outValue) {
  if (inText == nullptr || *inText < '0' || *inText > '9') return false;
  errno = 0;
  char* end = nullptr;
  const unsigned long long value = std::strtoull(inText, &end, 10);
  if (errno != 0 || end == inText || *end != '\0') return false;
  if (value < inMin || value > inMax) return false;
  outValue = value;
  return true;
}

}  // namespace

std::uint32_t DefaultWorkerCount() {
  const unsigned int hardware = std::thread::hardware_concurrency();
  return hardware < 2 ? 2 : (hardware > kMaxWorkers ? kMaxWorkers : hardware);
}

ParseResult ParseDemoOptions(int inArgc, const char* const* inArgv, DemoOptions& outOptions, std::string& outError) {
  outOptions = DemoOptions();
  outOptions.mWorkers = DefaultWorkerCount();
  for (int i = 1; i < inArgc; ++i) {
    std::string name = inArgv[i];
    const char* value = nullptr;
    // Both "--name=value" and "--name value" are accepted.
    const std::size_t equals = name.find('=');
    if (name.compare(0, 2, "--") == 0 && equals != std::string::npos) {
      value = inArgv[i] + equals + 1;
      name.resize(equals);
    }

    if (name == "--help" || name == "-h" || name == "--quiet" || name == "--json" || name == "--dump-stations") {
      if (value != nullptr) {
        outError = "option '" + name + "' takes no value";
        return ParseResult::kError;
      }
      if (name == "--help" || name == "-h") return ParseResult::kHelp;
      if (name == "--dump-stations") outOptions.mDumpStations = true;
      else (name == "--quiet" ? outOptions.mQuiet : outOptions.mJson) = true;
      continue;
    }

    std::uint64_t min = 0;
    std::uint64_t max = 0;
    if (name == "--workers") {
      min = 1;
      max = kMaxWorkers;
    } else if (name == "--messages") {
      min = 1;
      max = kMaxMessages;
    } else if (name == "--idle-ms") {
      min = 0;
      max = kMaxIdleMilliSeconds;
    } else if (name == "--trace-slow") {
      min = 0;
      max = kMaxTraceSlowMilliSeconds;
    } else {
      outError = "unknown option '" + std::string(inArgv[i]) + "'";
      return ParseResult::kError;
    }
    if (value == nullptr) {
      if (i + 1 >= inArgc) {
        outError = "option '" + name + "' needs a value";
        return ParseResult::kError;
      }
      value = inArgv[++i];
    }
    std::uint64_t number = 0;
    if (!ParseCount(value, min, max, number)) {
      outError = "option '" + name + "' needs a whole number from " + std::to_string(min) + " to " +
                 std::to_string(max) + ", not '" + value + "'";
      return ParseResult::kError;
    }
    if (name == "--workers") {
      outOptions.mWorkers = static_cast<std::uint32_t>(number);
    } else if (name == "--messages") {
      outOptions.mMessages = number;
    } else if (name == "--trace-slow") {
      outOptions.mTraceSlowMilliSeconds = static_cast<std::int64_t>(number);
    } else {
      outOptions.mIdleMilliSeconds = static_cast<std::uint32_t>(number);
    }
  }
  return ParseResult::kRun;
}

void PrintDemoHelp(std::FILE* inStream) {
  std::fprintf(inStream,
               "Usage: tarn-demo [options]\n"
               "\n"
               "A small host application for the TarnMessaging library. Worker threads do\n"
               "simulated work in three bursts and post progress messages to the status-bar\n"
               "station; the main thread runs an event loop that delivers them, broadcasts\n"
               "idle messages when nothing is pending, and autosaves through an idle\n"
               "countdown timer after each burst. Halfway through, the application is\n"
               "suspended for a moment: the status-bar station stops broadcasting and the\n"
               "progress messages that arrive meanwhile are dropped by design. At the end a\n"
               "summary accounts for every message posted. Workers keep at most 1,000\n"
               "messages waiting for the main thread.\n"
               "\n"
               "Options:\n"
               "  --workers N    posting threads, 1 to %u (default: one per hardware thread,\n"
               "                 at least 2; here %u)\n"
               "  --messages N   progress messages in total, shared out over the workers,\n"
               "                 1 to %llu (default 200000)\n"
               "  --idle-ms N    quiet time after a burst before the autosave, in\n"
               "                 milliseconds, 0 to %u (default 200)\n"
               "  --quiet        no progress output; only the summary\n"
               "  --json         the summary as one JSON object on stdout, and nothing else\n"
               "  --dump-stations  at the end of the run, every station of the registry with\n"
               "                 its state, retains and listeners (on stderr with --json)\n"
               "  --trace-slow MS  time every delivery and, after the summary, list the ten\n"
               "                 slowest handlers (listener, station, message) whose slowest\n"
               "                 delivery took MS milliseconds or more, 0 to %u (on stderr\n"
               "                 with --json)\n"
               "  --help         this text\n"
               "\n"
               "Exit status: 0 when every message is accounted for and nothing leaked;\n"
               "1 when a message was lost or duplicated, storage leaked, or another check\n"
               "failed (the summary names it); 2 for a bad command line.\n",
               kMaxWorkers, DefaultWorkerCount(), static_cast<unsigned long long>(kMaxMessages), kMaxIdleMilliSeconds,
               kMaxTraceSlowMilliSeconds);
}

}  // namespace tarn_demo
