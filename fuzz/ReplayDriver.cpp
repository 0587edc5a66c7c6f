// Stands in for libFuzzer's main in ordinary builds: feeds every file of the seed corpus to the target, then a
// bounded number of deterministic mutations of them (bit flips, truncations, splices), so that the sanitizer
// builds exercise the decoder on malformed input in every test run.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace {

constexpr int kMutationsPerSeed = 300;

std::vector<uint8_t> readFile(const std::filesystem::path& path) {
    std::ifstream in(path, std::ios::binary);
    return std::vector<uint8_t>(std::istreambuf_iterator<char>(in), {});
}

void run(const std::vector<uint8_t>& input) { LLVMFuzzerTestOneInput(input.data(), input.size()); }

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::vector<uint8_t>> seeds;
    for (int i = 1; i < argc; ++i) {
        std::filesystem::path p(argv[i]);
        if (std::filesystem::is_directory(p)) {
            for (const auto& entry : std::filesystem::directory_iterator(p))
                if (entry.is_regular_file()) seeds.push_back(readFile(entry.path()));
        } else {
            seeds.push_back(readFile(p));
        }
    }
    if (seeds.empty()) {
        std::fprintf(stderr, "no seed inputs found\n");
        return 1;
    }
    std::mt19937_64 rng(0xB3C11);
    size_t runs = 0;
    for (const auto& seed : seeds) {
        run(seed);
        ++runs;
        for (int m = 0; m < kMutationsPerSeed; ++m) {
            std::vector<uint8_t> input = seed;
            switch (rng() % 4) {
                case 0:  // flip a few bits
                    for (int k = 0; k < 1 + static_cast<int>(rng() % 4) && !input.empty(); ++k)
                        input[rng() % input.size()] ^= static_cast<uint8_t>(1u << (rng() % 8));
                    break;
                case 1:  // truncate
                    if (!input.empty()) input.resize(rng() % input.size());
                    break;
                case 2: {  // splice with another seed
                    const auto& other = seeds[rng() % seeds.size()];
                    if (!other.empty() && !input.empty()) {
                        size_t at = rng() % input.size();
                        size_t from = rng() % other.size();
                        input.resize(at);
                        input.insert(input.end(), other.begin() + static_cast<long>(from), other.end());
                    }
                    break;
                }
                default:  // overwrite a byte with an interesting value
                    if (!input.empty()) {
                        static constexpr uint8_t kInteresting[] = {0, 0x7f, 0x80, 0xff, '<', '>', '&', '"'};
                        input[rng() % input.size()] = kInteresting[rng() % sizeof kInteresting];
                    }
            }
            run(input);
            ++runs;
        }
    }
    std::printf("replayed %zu inputs from %zu seeds\n", runs, seeds.size());
    return 0;
}
