// Writes one realistic document for every top-level DMAP code, one file a
// code, into the folder given: the starting points of the DMAP fuzz targets.
// scripts/fuzz.sh runs it before fuzzing; fuzz/corpus/dmap/ was made with it:
//   dmap_seed_writer fuzz/corpus/dmap

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "tests/unit/dmap/DAAPTestSupport.h"

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: %s <folder>\n", argv[0]);
    return 2;
  }
  const std::filesystem::path folder(argv[1]);
  std::filesystem::create_directories(folder);
  for (const auto& [name, top] : larder::dmaptest::seedDocuments()) {
    const larder::PlistData bytes = larder::dmaptest::document(top);
    const std::filesystem::path path = folder / (name + ".dmap");
    std::ofstream out(path, std::ios::binary);
    out.write(reinterpret_cast<const char*>(bytes.data()),
              static_cast<std::streamsize>(bytes.size()));
    if (!out.flush()) {
      std::fprintf(stderr, "could not write %s\n", path.c_str());
      return 1;
    }
  }
  return 0;
}
