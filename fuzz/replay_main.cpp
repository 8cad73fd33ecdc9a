// Plain driver for the fuzz entry point, for compilers without libFuzzer:
// replays every file of the given files or directories, and for each also
// every prefix and a set of single-byte damages, so that a build without
// clang still exercises the parser beyond its seeds.
#include <dirent.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace {

void Run(const std::string& input) {
  LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(input.data()), input.size());
}

void Replay(const std::string& seed, long* runs) {
  Run(seed);
  ++*runs;
  for (size_t n = 0; n < seed.size(); ++n) {
    Run(seed.substr(0, n));
    ++*runs;
  }
  const char damages[] = {'\t', '\n', '%', '\0', '\\', ' ', '9', '-', '\xff'};
  for (size_t i = 0; i < seed.size(); ++i) {
    for (char d : damages) {
      std::string damaged = seed;
      damaged[i] = d;
      Run(damaged);
      ++*runs;
    }
  }
}

std::vector<std::string> Inputs(const std::string& path) {
  std::vector<std::string> files;
  if (DIR* d = opendir(path.c_str())) {
    while (struct dirent* e = readdir(d)) {
      if (e->d_name[0] != '.') files.push_back(path + "/" + e->d_name);
    }
    closedir(d);
    std::sort(files.begin(), files.end());
  } else {
    files.push_back(path);
  }
  return files;
}

}  // namespace

int main(int argc, char** argv) {
  int seeds = 0;
  long runs = 0;
  for (int i = 1; i < argc; ++i) {
    for (const std::string& file : Inputs(argv[i])) {
      std::ifstream in(file, std::ios::binary);
      if (!in) {
        std::fprintf(stderr, "cannot read %s\n", file.c_str());
        return 2;
      }
      std::ostringstream text;
      text << in.rdbuf();
      Replay(text.str(), &runs);
      ++seeds;
    }
  }
  std::printf("replayed %d seeds, %ld inputs\n", seeds, runs);
  return seeds > 0 ? 0 : 1;  // an empty corpus means a wrong path
}
