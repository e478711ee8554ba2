// Replay driver for fuzz targets built without libFuzzer: runs every file of a
// corpus folder, then a fixed number of deterministic byte mutations of them.
// usage: <target> CORPUS_DIR [MUTATIONS]
#include <dirent.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>
#include <sstream>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv) {
    if (argc < 2) {
        fprintf(stderr, "usage: %s CORPUS_DIR [MUTATIONS]\n", argv[0]);
        return 2;
    }
    std::vector<std::string> seeds;
    DIR* dir = opendir(argv[1]);
    if (dir == nullptr) {
        fprintf(stderr, "%s: cannot open corpus folder %s\n", argv[0], argv[1]);
        return 2;
    }
    for (dirent* e = readdir(dir); e != nullptr; e = readdir(dir)) {
        if (e->d_name[0] == '.') continue;
        std::ifstream in(std::string(argv[1]) + "/" + e->d_name, std::ios::binary);
        std::ostringstream ss;
        ss << in.rdbuf();
        seeds.push_back(ss.str());
    }
    closedir(dir);
    if (seeds.empty()) seeds.push_back("");
    for (const std::string& s : seeds)
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(s.data()), s.size());

    long mutations = argc > 2 ? strtol(argv[2], nullptr, 10) : 1000;
    std::mt19937 rng(12345);  // fixed seed: the same inputs on every run
    for (long i = 0; i < mutations; ++i) {
        std::string input = seeds[rng() % seeds.size()];
        int edits = 1 + static_cast<int>(rng() % 8);
        for (int k = 0; k < edits; ++k) {
            size_t pos = input.empty() ? 0 : rng() % input.size();
            switch (rng() % 4) {
                case 0:
                    if (!input.empty()) input[pos] = static_cast<char>(rng() % 256);
                    break;
                case 1:
                    input.insert(pos, 1, "\"\\=[]#;\n \t"[rng() % 11]);
                    break;
                case 2:
                    if (!input.empty()) input.erase(pos, 1 + rng() % 4);
                    break;
                default:
                    input.insert(pos, seeds[rng() % seeds.size()].substr(0, rng() % 32));
            }
        }
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(input.data()), input.size());
    }
    printf("%zu seeds and %ld mutations ran\n", seeds.size(), mutations);
    return 0;
}
