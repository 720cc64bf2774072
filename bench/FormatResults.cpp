// tarn-bench-table: reads the JSON that tarn-bench writes (Google Benchmark's
// format, run with repetitions) and prints the medians as Markdown tables,
// with ratios against the peers measured in the same run and, for each of
// the team's targets, whether the figures meet it.
//
//   tarn-bench-table build/default/bench-results.json > table.md
//
// Written in C++ with boost::property_tree so that a fresh machine needs
// nothing beyond the build's own dependencies. Exit status: 0 when no
// benchmark reported an error (a failed correctness check), 1 when one did,
// 2 when the file cannot be read. Missed targets are reported, not
// turned into a failure.
#include <boost/property_tree/json_parser.hpp>
#include <boost/property_tree/ptree.hpp>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <iostream>
#include <map>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <vector>

namespace {

using boost::property_tree::ptree;

// The figures of one benchmark (name without Google Benchmark's suffixes).
struct Result {
  std::map<std::string, double> mMedian;                // field -> median over repetitions
  std::map<std::string, double> mCv;                    // field -> coefficient of variation
  std::map<std::string, double> mMin;                   // field -> smallest over repetitions
  std::map<std::string, double> mMax;                   // field -> largest over repetitions
  std::map<std::string, std::vector<double>> mSamples;  // field -> per-repetition values
  bool mError = false;
  std::string mErrorMessage;
};

// "Posting/Tarn/1/min_time:0.300/manual_time" -> "Posting/Tarn/1".
std::string BaseName(const std::string& inRunName) {
  std::string result;
  std::stringstream parts(inRunName);
  std::string part;
  while (std::getline(parts, part, '/')) {
    if (part.find(':') != std::string::npos || part == "manual_time" || part == "real_time" ||
        part == "process_time")
      continue;
    if (!result.empty()) result += '/';
    result += part;
  }
  return result;
}

// Google Benchmark writes a coefficient of variation of 0/0 as a bare NaN
// (and overflows as Infinity), which is not JSON; quote them so the parser
// takes them as text, which is then not a number.
std::string QuoteNonFiniteNumbers(std::string inText) {
  for (const char* token : {": NaN", ": -Infinity", ": Infinity"}) {
    const std::string bare(token);
    const std::string quoted = ": \"" + bare.substr(2) + "\"";
    for (std::size_t at = inText.find(bare); at != std::string::npos; at = inText.find(bare, at + quoted.size()))
      inText.replace(at, bare.size(), quoted);
  }
  return inText;
}

std::optional<double> ToNumber(const std::string& inText) {
  try {
    std::size_t used = 0;
    const double value = std::stod(inText, &used);
    if (used != inText.size()) return std::nullopt;
    return value;
  } catch (...) {
    return std::nullopt;
  }
}

double Median(std::vector<double> inValues) {
  std::sort(inValues.begin(), inValues.end());
  const std::size_t n = inValues.size();
  return n % 2 == 1 ? inValues[n / 2] : (inValues[n / 2 - 1] + inValues[n / 2]) / 2.0;
}

class Results {
public:
  explicit Results(const ptree& inRoot) {
    for (const auto& element : inRoot.get_child("benchmarks")) {
      const ptree& entry = element.second;
      const std::string name = BaseName(entry.get<std::string>("run_name", entry.get<std::string>("name", "")));
      Result& result = mResults[name];
      if (entry.get<std::string>("error_occurred", "false") == "true") {
        result.mError = true;
        result.mErrorMessage = entry.get<std::string>("error_message", "error");
        continue;
      }
      const std::string runType = entry.get<std::string>("run_type", "iteration");
      const std::string aggregate = entry.get<std::string>("aggregate_name", "");
      for (const auto& field : entry) {
        if (!field.second.empty()) continue;  // nested object or array
        const std::optional<double> value = ToNumber(field.second.data());
        if (!value) continue;
        if (runType == "aggregate" && aggregate == "median") result.mMedian[field.first] = *value;
        else if (runType == "aggregate" && aggregate == "cv") result.mCv[field.first] = *value;
        else if (runType == "aggregate" && aggregate == "min") result.mMin[field.first] = *value;
        else if (runType == "aggregate" && aggregate == "max") result.mMax[field.first] = *value;
        else if (runType != "aggregate") result.mSamples[field.first].push_back(*value);
      }
    }
    // Without aggregates (one repetition, or aggregates not reported), the
    // median is taken here.
    for (auto& [name, result] : mResults) {
      for (const auto& [field, samples] : result.mSamples) {
        if (result.mMedian.count(field) == 0 && !samples.empty()) result.mMedian[field] = Median(samples);
      }
    }
  }

  bool Has(const std::string& inName) const { return mResults.count(inName) != 0; }

  // The median of a field, or nothing when the benchmark is absent, failed,
  // or lacks the field.
  std::optional<double> Get(const std::string& inName, const std::string& inField) const {
    const auto found = mResults.find(inName);
    if (found == mResults.end() || found->second.mError) return std::nullopt;
    const auto field = found->second.mMedian.find(inField);
    if (field == found->second.mMedian.end()) return std::nullopt;
    return field->second;
  }

  // The best repetition's value of a field: the largest when larger is
  // better (a rate), otherwise the smallest.
  std::optional<double> Best(const std::string& inName, const std::string& inField, bool inLargerIsBetter) const {
    const auto found = mResults.find(inName);
    if (found == mResults.end() || found->second.mError) return std::nullopt;
    const auto& values = inLargerIsBetter ? found->second.mMax : found->second.mMin;
    const auto field = values.find(inField);
    if (field == values.end()) return std::nullopt;
    return field->second;
  }

  // Nanoseconds per item (delivery, attach+detach pair): of the median
  // repetition, or of the fastest with inBest.
  std::optional<double> NsPerItem(const std::string& inName, bool inBest = false) const {
    const std::optional<double> rate =
        inBest ? Best(inName, "items_per_second", true) : Get(inName, "items_per_second");
    if (!rate || *rate <= 0.0) return std::nullopt;
    return 1e9 / *rate;
  }

  std::optional<double> Cv(const std::string& inName, const std::string& inField) const {
    const auto found = mResults.find(inName);
    if (found == mResults.end()) return std::nullopt;
    const auto field = found->second.mCv.find(inField);
    if (field == found->second.mCv.end()) return std::nullopt;
    return field->second;
  }

  const std::map<std::string, Result>& All() const { return mResults; }

private:
  std::map<std::string, Result> mResults;
};

std::string Format(std::optional<double> inValue, int inDecimals) {
  if (!inValue) return "n/a";
  char text[64];
  std::snprintf(text, sizeof text, "%.*f", inDecimals, *inValue);
  return text;
}

// Few significant digits for a time in nanoseconds.
std::string FormatNs(std::optional<double> inValue) {
  if (!inValue) return "n/a";
  return Format(inValue, *inValue < 10.0 ? 2 : (*inValue < 100.0 ? 1 : 0));
}

std::optional<double> Ratio(std::optional<double> inA, std::optional<double> inB) {
  if (!inA || !inB || *inB == 0.0) return std::nullopt;
  return *inA / *inB;
}

struct Row {
  const char* mKey;    // benchmark name part
  const char* mLabel;  // what the table shows
};

class Printer {
public:
  explicit Printer(const Results& inResults) : mResults(inResults) {}

  void Context(const ptree& inRoot) {
    const ptree& context = inRoot.get_child("context");
    std::string load;
    if (const auto loads = context.get_child_optional("load_avg")) {
      for (const auto& value : *loads) load += (load.empty() ? "" : " ") + Format(ToNumber(value.second.data()), 2);
    }
    std::cout << "Run of " << context.get<std::string>("date", "?") << " on " << context.get<std::string>("num_cpus", "?")
              << " CPUs at " << context.get<std::string>("mhz_per_cpu", "?") << " MHz, load average " << load
              << " at the start; medians of " << Repetitions() << " repetitions.\n\n";
  }

  void Delivery() {
    std::cout << "### 1. Synchronous broadcast to N listeners: ns per delivery\n\n";
    const Row rows[] = {{"Floor", "raw loop of virtual calls (floor)"},
                        {"Signals2", "boost::signals2"},
                        {"Sigc", "libsigc++ 3"},
                        {"TarnPlain", "Tarn Broadcaster, Listener*"},
                        {"TarnWeak", "Tarn Broadcaster, std::weak_ptr"},
                        {"TarnStation", "Tarn station by ID (StationUtils)"}};
    const int sizes[] = {1, 10, 100, 1000};
    std::cout << "| ns per delivery | N=1 | N=10 | N=100 | N=1000 |\n|---|---:|---:|---:|---:|\n";
    for (const Row& row : rows) {
      if (!Present(std::string("Delivery/") + row.mKey + "/1")) continue;
      std::cout << "| " << row.mLabel;
      for (const int n : sizes) std::cout << " | " << FormatNs(DeliveryNs(row.mKey, n));
      std::cout << " |\n";
    }
    std::cout << "\n| ratio to boost::signals2 (lower is faster) | N=1 | N=10 | N=100 | N=1000 |\n"
                 "|---|---:|---:|---:|---:|\n";
    for (const Row& row : rows) {
      if (std::string(row.mKey) == "Signals2" || !Present(std::string("Delivery/") + row.mKey + "/1")) continue;
      std::cout << "| " << row.mLabel;
      for (const int n : sizes) std::cout << " | " << Format(Ratio(DeliveryNs(row.mKey, n), DeliveryNs("Signals2", n)), 2);
      std::cout << " |\n";
    }
    std::cout << "\n| ratio to boost::signals2, fastest repetitions | N=1 | N=10 | N=100 | N=1000 |\n"
                 "|---|---:|---:|---:|---:|\n";
    for (const Row& row : rows) {
      if (std::string(row.mKey) == "Signals2" || !Present(std::string("Delivery/") + row.mKey + "/1")) continue;
      std::cout << "| " << row.mLabel;
      for (const int n : sizes) {
        const std::string suffix = "/" + std::to_string(n);
        std::cout << " | "
                  << Format(Ratio(mResults.NsPerItem(std::string("Delivery/") + row.mKey + suffix, true),
                                  mResults.NsPerItem("Delivery/Signals2" + suffix, true)),
                            2);
      }
      std::cout << " |\n";
    }
    std::cout << "\n";
  }

  void Posting() {
    std::cout << "### 2. Posting from worker threads to the main thread\n\n";
    const Row rows[] = {{"Tarn", "Tarn PostMessageToUIThread + FlushPostedMessagesOnUIThread"},
                        {"Asio", "boost::asio::io_context post + run"},
                        {"MutexQueue", "std::mutex + std::deque + std::condition_variable"}};
    std::cout << "| posts per second, first post to last delivery (millions) | P=1 | P=2 | P=1 ratio to asio | P=2 "
                 "ratio to asio |\n|---|---:|---:|---:|---:|\n";
    for (const Row& row : rows) {
      std::cout << "| " << row.mLabel;
      for (const int p : {1, 2}) std::cout << " | " << Format(Millions(PostRate(row.mKey, p)), 2);
      for (const int p : {1, 2}) std::cout << " | " << Format(Ratio(PostRate(row.mKey, p), PostRate("Asio", p)), 2);
      std::cout << " |\n";
    }
    std::cout << "\n| post-to-delivery latency at 10,000 posts/s, one producer | p50 (us) | p99 (us) | p50 ratio to "
                 "asio | p99 ratio to asio |\n|---|---:|---:|---:|---:|\n";
    for (const Row& row : rows) {
      const std::string name = std::string("Latency/") + row.mKey;
      if (!Present(name)) continue;
      std::cout << "| " << row.mLabel << " | " << Format(mResults.Get(name, "p50_us"), 1) << " | "
                << Format(mResults.Get(name, "p99_us"), 1) << " | "
                << Format(Ratio(mResults.Get(name, "p50_us"), mResults.Get("Latency/Asio", "p50_us")), 2) << " | "
                << Format(Ratio(mResults.Get(name, "p99_us"), mResults.Get("Latency/Asio", "p99_us")), 2) << " |\n";
    }
    std::cout << "\n";
  }

  void Attach() {
    std::cout << "### 3. Attach and detach one listener while N others stay attached: ns per pair\n\n";
    const Row rows[] = {{"Signals2", "boost::signals2 connect + disconnect"},
                        {"Sigc", "libsigc++ 3 connect + disconnect"},
                        {"TarnPlain", "Tarn AddListener + RemoveListener (Listener*)"}};
    std::cout << "| ns per attach+detach | N=10 | N=1000 | N=10 ratio to signals2 | N=1000 ratio to signals2 |\n"
                 "|---|---:|---:|---:|---:|\n";
    for (const Row& row : rows) {
      if (!Present(std::string("Attach/") + row.mKey + "/10")) continue;
      std::cout << "| " << row.mLabel;
      for (const int n : {10, 1000}) std::cout << " | " << FormatNs(AttachNs(row.mKey, n));
      for (const int n : {10, 1000}) std::cout << " | " << Format(Ratio(AttachNs(row.mKey, n), AttachNs("Signals2", n)), 2);
      std::cout << " |\n";
    }
    std::cout << "\n";
  }

  void Allocations() {
    std::cout << "### 4. Allocations\n\n";
    std::cout << "| per delivery (N=100, 1,000 broadcasts) | general-heap allocations | small-block blocks |\n"
                 "|---|---:|---:|\n";
    const Row deliveries[] = {{"Signals2", "boost::signals2"},
                              {"Sigc", "libsigc++ 3"},
                              {"TarnPlain", "Tarn Broadcaster, Listener*"},
                              {"TarnWeak", "Tarn Broadcaster, std::weak_ptr"},
                              {"TarnStation", "Tarn station by ID"}};
    for (const Row& row : deliveries) {
      const std::string name = std::string("Alloc/Delivery/") + row.mKey;
      if (!Present(name)) continue;
      std::cout << "| " << row.mLabel << " | " << Format(mResults.Get(name, "heap_allocs_per_op"), 4) << " | "
                << Format(mResults.Get(name, "small_blocks_per_op"), 4) << " |\n";
    }
    std::cout << "\n| per post (10,000 posts, delivered) | general-heap allocations | small-block blocks |\n"
                 "|---|---:|---:|\n";
    const Row posts[] = {{"TarnDirect", "Tarn, main thread, inForceAsync false (direct)"},
                         {"TarnDeferredMain", "Tarn, main thread, inForceAsync true (deferred)"},
                         {"TarnDeferredWorker", "Tarn, worker thread (deferred)"},
                         {"AsioWorker", "boost::asio post, worker thread"},
                         {"MutexQueueWorker", "mutex + deque queue, worker thread"}};
    for (const Row& row : posts) {
      const std::string name = std::string("Alloc/Post/") + row.mKey;
      if (!Present(name)) continue;
      std::cout << "| " << row.mLabel << " | " << Format(mResults.Get(name, "heap_allocs_per_op"), 4) << " | "
                << Format(mResults.Get(name, "small_blocks_per_op"), 4) << " |\n";
    }
    std::cout << "\n| per registered listener (1,000 attached) | small-block bytes | general-heap bytes (usable "
                 "size) | general-heap allocations |\n|---|---:|---:|---:|\n";
    const Row listeners[] = {{"Signals2", "boost::signals2"},
                             {"Sigc", "libsigc++ 3"},
                             {"TarnPlain", "Tarn Broadcaster, Listener*"},
                             {"TarnWeak", "Tarn Broadcaster, std::weak_ptr"}};
    for (const Row& row : listeners) {
      const std::string name = std::string("Alloc/Listener/") + row.mKey;
      if (!Present(name)) continue;
      std::cout << "| " << row.mLabel << " | " << Format(mResults.Get(name, "small_block_bytes_per_listener"), 1)
                << " | " << Format(mResults.Get(name, "heap_bytes_per_listener"), 1) << " | "
                << Format(mResults.Get(name, "heap_allocs_per_listener"), 2) << " |\n";
    }
    std::cout << "\n";
  }

  void Targets() {
    std::cout << "### Targets\n\nVerdicts from the medians; the fastest repetition of each row, which other work "
                 "on the machine disturbs least, is shown beside them.\n\n"
                 "| target | median | fastest repetitions | verdict |\n|---|---|---|---|\n";
    const auto deliveryRatio = [this](bool inBest) {
      return Ratio(mResults.NsPerItem("Delivery/TarnPlain/100", inBest), mResults.NsPerItem("Delivery/Signals2/100", inBest));
    };
    Required("Delivery/TarnPlain/100");
    Required("Delivery/Signals2/100");
    Target("delivery at N=100, Listener*, at most 0.75 of signals2's time", "ratio " + Format(deliveryRatio(false), 2),
           "ratio " + Format(deliveryRatio(true), 2), deliveryRatio(false) && *deliveryRatio(false) <= 0.75,
           deliveryRatio(true) && *deliveryRatio(true) <= 0.75);
    for (const int p : {1, 2}) {
      const std::string tarn = "Posting/Tarn/" + std::to_string(p);
      const std::string asio = "Posting/Asio/" + std::to_string(p);
      const auto ratio = Ratio(PostRate("Tarn", p), PostRate("Asio", p));
      const auto best = Ratio(mResults.Best(tarn, "items_per_second", true), mResults.Best(asio, "items_per_second", true));
      Target("posting throughput at P=" + std::to_string(p) + " at least asio's", "ratio " + Format(ratio, 2),
             "ratio " + Format(best, 2), ratio && *ratio >= 1.0, best && *best >= 1.0);
    }
    const auto p50 = Ratio(mResults.Get("Latency/Tarn", "p50_us"), mResults.Get("Latency/Asio", "p50_us"));
    const auto p50Best =
        Ratio(mResults.Best("Latency/Tarn", "p50_us", false), mResults.Best("Latency/Asio", "p50_us", false));
    Target("p50 post-to-delivery latency no worse than asio's",
           Format(mResults.Get("Latency/Tarn", "p50_us"), 1) + " us vs " +
               Format(mResults.Get("Latency/Asio", "p50_us"), 1) + " us, ratio " + Format(p50, 2),
           "ratio " + Format(p50Best, 2), p50 && *p50 <= 1.0, p50Best && *p50Best <= 1.0);
    const auto attach = [this](bool inBest) {
      return Ratio(mResults.NsPerItem("Attach/TarnPlain/10", inBest), mResults.NsPerItem("Attach/Signals2/10", inBest));
    };
    Required("Attach/TarnPlain/10");
    Required("Attach/Signals2/10");
    Target("attach+detach at N=10 at most half of signals2's time", "ratio " + Format(attach(false), 2),
           "ratio " + Format(attach(true), 2), attach(false) && *attach(false) <= 0.5, attach(true) && *attach(true) <= 0.5);
    std::string heapText;
    bool heapZero = true;
    for (const char* key : {"TarnPlain", "TarnWeak", "TarnStation"}) {
      const auto heap = mResults.Get(std::string("Alloc/Delivery/") + key, "heap_allocs_per_op");
      heapText += (heapText.empty() ? "" : ", ") + std::string(key) + " " + Format(heap, 4);
      heapZero = heapZero && heap && *heap == 0.0;
    }
    Target("zero general-heap allocations per delivery", heapText, "(a count)", heapZero, heapZero);
    const auto direct = mResults.Get("Alloc/Post/TarnDirect", "heap_allocs_per_op");
    const bool directZero = direct && *direct == 0.0;
    Target("zero general-heap allocations on the direct post path", Format(direct, 4), "(a count)", directZero,
           directZero);
    std::string blockText;
    bool oneBlock = true;
    for (const char* key : {"TarnDeferredMain", "TarnDeferredWorker"}) {
      const auto blocks = mResults.Get(std::string("Alloc/Post/") + key, "small_blocks_per_op");
      blockText += (blockText.empty() ? "" : ", ") + std::string(key) + " " + Format(blocks, 4);
      oneBlock = oneBlock && blocks && *blocks <= 1.0;
    }
    Target("one small-block block per deferred post", blockText, "(a count)", oneBlock, oneBlock);
    std::cout << "\n" << mMet << " of " << mMet + mMissed << " targets met by the medians.\n\n";
  }

  // Rows whose figure varied by more than 10% between repetitions (the
  // median is still what the tables show; these deserve a quieter rerun).
  void Noise() {
    std::string noisy;
    for (const auto& [name, result] : mResults.All()) {
      if (name.rfind("Alloc/", 0) == 0) continue;  // counts, not times
      const char* field = name.rfind("Latency/", 0) == 0 ? "p50_us" : "items_per_second";
      const auto cv = mResults.Cv(name, field);
      if (cv && *cv > 0.10) noisy += (noisy.empty() ? "" : ", ") + name + " " + Format(*cv * 100.0, 0) + "%";
    }
    if (!noisy.empty())
      std::cout << "Rows whose figure varied by more than 10% between repetitions (coefficient of variation): "
                << noisy << ".\n\n";
  }

  // Benchmarks that failed a check; those absent from the results (a
  // filtered run) are listed but are not failures.
  int Failures() {
    if (!mMissingNames.empty()) {
      std::string missing;
      for (const std::string& name : mMissingNames) missing += (missing.empty() ? "" : ", ") + name;
      std::cout << "Not in these results (n/a above): " << missing << ".\n\n";
    }
    int failures = 0;
    for (const auto& [name, result] : mResults.All()) {
      if (!result.mError) continue;
      std::cout << "FAILED: " << name << ": " << result.mErrorMessage << "\n";
      ++failures;
    }
    return failures;
  }

private:
  bool Present(const std::string& inName) { return mResults.Has(inName); }

  std::optional<double> DeliveryNs(const std::string& inKey, int inN) {
    return Required("Delivery/" + inKey + "/" + std::to_string(inN));
  }
  std::optional<double> AttachNs(const std::string& inKey, int inN) {
    return Required("Attach/" + inKey + "/" + std::to_string(inN));
  }
  std::optional<double> PostRate(const std::string& inKey, int inP) {
    const std::string name = "Posting/" + inKey + "/" + std::to_string(inP);
    if (!mResults.Has(name)) NoteMissing(name);
    return mResults.Get(name, "items_per_second");
  }
  std::optional<double> Required(const std::string& inName) {
    if (!mResults.Has(inName)) NoteMissing(inName);
    return mResults.NsPerItem(inName);
  }
  void NoteMissing(const std::string& inName) {
    // libsigc++ rows are optional.
    if (inName.find("Sigc") == std::string::npos) mMissingNames.insert(inName);
  }
  static std::optional<double> Millions(std::optional<double> inValue) {
    if (!inValue) return std::nullopt;
    return *inValue / 1e6;
  }
  int Repetitions() const {
    std::size_t most = 0;
    for (const auto& [name, result] : mResults.All()) {
      const auto samples = result.mSamples.find("real_time");
      if (samples != result.mSamples.end()) most = std::max(most, samples->second.size());
    }
    // Aggregates only: the count is in each aggregate's "repetitions" field.
    for (const auto& [name, result] : mResults.All()) {
      const auto repetitions = result.mMedian.find("repetitions");
      if (repetitions != result.mMedian.end()) most = std::max(most, static_cast<std::size_t>(repetitions->second));
    }
    return static_cast<int>(most);
  }
  // One row: the verdict is the median's; a different verdict of the fastest
  // repetitions is noted beside it.
  void Target(const std::string& inWhat, const std::string& inMedian, const std::string& inBest, bool inMet,
              bool inBestMet) {
    std::cout << "| " << inWhat << " | " << inMedian << " | " << inBest << " | " << (inMet ? "met" : "**missed**");
    if (inMet != inBestMet) std::cout << (inBestMet ? " (met by the fastest)" : " (missed by the fastest)");
    std::cout << " |\n";
    (inMet ? mMet : mMissed)++;
  }

  const Results& mResults;
  int mMet = 0;
  int mMissed = 0;
  std::set<std::string> mMissingNames;
};

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::cerr << "usage: tarn-bench-table RESULTS.json\n";
    return 2;
  }
  ptree root;
  try {
    std::ifstream file(argv[1]);
    if (!file) throw std::runtime_error("cannot open the file");
    std::stringstream text;
    text << file.rdbuf();
    std::stringstream json(QuoteNonFiniteNumbers(text.str()));
    boost::property_tree::read_json(json, root);
  } catch (const std::exception& inError) {
    std::cerr << "tarn-bench-table: cannot read " << argv[1] << ": " << inError.what() << "\n";
    return 2;
  }
  try {
    const Results results(root);
    Printer printer(results);
    printer.Context(root);
    printer.Delivery();
    printer.Posting();
    printer.Attach();
    printer.Allocations();
    printer.Targets();
    printer.Noise();
    return printer.Failures() == 0 ? 0 : 1;
  } catch (const std::exception& inError) {
    std::cerr << "tarn-bench-table: unexpected content in " << argv[1] << ": " << inError.what() << "\n";
    return 2;
  }
}
