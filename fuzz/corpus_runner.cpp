// main() of the corpus regression tests: runs a fuzz target's
// LLVMFuzzerTestOneInput once over every saved input, as libFuzzer would
// when given the files, but with any compiler and without libFuzzer.
//
//   FuzzRuleConfCorpus CORPUS_DIR [--optional DIR]...
//
// CORPUS_DIR must hold at least one input; an --optional folder (the
// target's saved crashes) may be missing or empty. A broken promise aborts
// the process, which fails the test and names the input last started.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);
extern "C" __attribute__((weak)) int LLVMFuzzerInitialize(int *argc,
                                                          char ***argv);

namespace {

namespace fs = std::filesystem;

// Regular files directly in folder, in name order (hidden ones left out).
bool ListInputs(const fs::path &folder, bool optional,
                std::vector<fs::path> &inputs) {
  std::error_code error;
  if (!fs::is_directory(folder, error)) {
    if (optional) {
      return true;
    }
    std::fprintf(stderr, "corpus folder %s is missing\n", folder.c_str());
    return false;
  }
  std::vector<fs::path> found;
  for (const auto &entry : fs::directory_iterator(folder, error)) {
    if (entry.is_regular_file() &&
        entry.path().filename().string().front() != '.') {
      found.push_back(entry.path());
    }
  }
  if (error) {
    std::fprintf(stderr, "cannot list %s: %s\n", folder.c_str(),
                 error.message().c_str());
    return false;
  }
  std::sort(found.begin(), found.end());
  if (found.empty() && !optional) {
    std::fprintf(stderr, "corpus folder %s holds no input\n", folder.c_str());
    return false;
  }
  inputs.insert(inputs.end(), found.begin(), found.end());
  return true;
}

} // namespace

int main(int argc, char **argv) {
  std::vector<fs::path> inputs;
  bool sawCorpus = false;
  for (int i = 1; i < argc; ++i) {
    const bool optional = std::strcmp(argv[i], "--optional") == 0;
    if (optional && i + 1 >= argc) {
      std::fprintf(stderr, "--optional needs a folder\n");
      return 2;
    }
    const char *folder = optional ? argv[++i] : argv[i];
    sawCorpus = sawCorpus || !optional;
    if (!ListInputs(folder, optional, inputs)) {
      return 1;
    }
  }
  if (!sawCorpus) {
    std::fprintf(stderr, "usage: %s CORPUS_DIR [--optional DIR]...\n", argv[0]);
    return 2;
  }
  if (LLVMFuzzerInitialize != nullptr) {
    int ignoredArgc = 1;
    LLVMFuzzerInitialize(&ignoredArgc, &argv);
  }
  for (const fs::path &input : inputs) {
    std::ifstream in(input, std::ios::binary);
    std::vector<char> bytes((std::istreambuf_iterator<char>(in)),
                            std::istreambuf_iterator<char>());
    if (!in.eof() && in.fail()) {
      std::fprintf(stderr, "cannot read %s\n", input.c_str());
      return 1;
    }
    std::fprintf(stderr, "running %s (%zu bytes)\n", input.c_str(),
                 bytes.size());
    // A copy of exactly the input's size, so that a read past its end is
    // seen by AddressSanitizer as it is under libFuzzer.
    std::vector<uint8_t> data(bytes.begin(), bytes.end());
    LLVMFuzzerTestOneInput(data.empty() ? nullptr : data.data(), data.size());
  }
  std::printf("%zu input(s) kept every promise\n", inputs.size());
  return 0;
}
