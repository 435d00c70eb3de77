// Runs a libFuzzer target without libFuzzer: every file of its corpus
// directory (tests/corpus/<target>/) first, then seeded random inputs built by
// mutating those files. Lets the ordinary sanitizer build exercise each fuzz
// target on every test run; real fuzzing uses the clang build (make fuzz).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

static std::vector<std::vector<uint8_t>> loadCorpus(const std::string& dir) {
  std::vector<std::vector<uint8_t>> out;
  std::error_code missing;
  for (const auto& e : std::filesystem::directory_iterator(dir, missing)) {
    std::ifstream f(e.path(), std::ios::binary);
    out.emplace_back(std::istreambuf_iterator<char>(f), std::istreambuf_iterator<char>());
  }
  return out;
}

int main(int argc, char** argv) {
  long runs = argc > 1 ? strtol(argv[1], nullptr, 10) : 1000;
  const char* base = strrchr(argv[0], '/');
  base = base ? base + 1 : argv[0];
  auto corpus = loadCorpus(std::string(KLP_SOURCE_DIR) + "/tests/corpus/" + base);
  for (auto& in : corpus) LLVMFuzzerTestOneInput(in.data(), in.size());
  if (corpus.empty()) corpus.push_back({});

  std::mt19937_64 rng(20261206);
  for (long i = 0; i < runs; ++i) {
    std::vector<uint8_t> in = corpus[rng() % corpus.size()];
    int edits = 1 + static_cast<int>(rng() % 8);
    for (int k = 0; k < edits; ++k) {
      switch (rng() % 4) {
        case 0:  // flip a byte
          if (!in.empty()) in[rng() % in.size()] = static_cast<uint8_t>(rng());
          break;
        case 1:  // insert random bytes
          for (size_t n = rng() % 16; n > 0; --n)
            in.insert(in.begin() + (in.empty() ? 0 : rng() % (in.size() + 1)), static_cast<uint8_t>(rng()));
          break;
        case 2:  // truncate
          if (!in.empty()) in.resize(rng() % in.size());
          break;
        default:  // grow with a repeated byte, to reach length limits
          in.resize(in.size() + rng() % 2048, static_cast<uint8_t>(rng()));
          break;
      }
    }
    LLVMFuzzerTestOneInput(in.data(), in.size());
  }
  printf("%s: %zu corpus inputs and %ld generated inputs ran cleanly\n", base, corpus.size(), runs);
  return 0;
}
