// A stand-in for libFuzzer's driver where the compiler has none (g++): runs
// every input of the corpus, then a bounded number of mutations of them with
// a fixed seed, so that a normal or sanitizer build keeps the targets alive
// and a failure repeats exactly.
//
// usage: TARGET [-runs=N] [-seed=N] CORPUS_DIR_OR_FILE...
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <random>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

namespace {

using Input = std::vector<uint8_t>;

Input read_input(const std::filesystem::path &path)
{
    std::ifstream in(path, std::ios::binary);
    return Input(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

void run(const Input &input)
{
    // A copy of the exact length, so a read past the end is caught.
    std::unique_ptr<uint8_t[]> exact(new uint8_t[std::max<size_t>(input.size(), 1)]);
    std::copy(input.begin(), input.end(), exact.get());
    LLVMFuzzerTestOneInput(exact.get(), input.size());
}

// Values at the edges of the 16- and 32-bit words that the bodies carry.
const uint32_t kInteresting[] = {0, 1, 0x7F, 0x80, 0xFF, 0x100, 0x3FF, 0x400, 0x401, 0x7FFF, 0x8000,
                                 0xFFFE, 0xFFFF, 0x1000, 0x1001, 0x7FFFFFFF, 0x80000000, 0xFFFFFFFF};

void mutate(Input &input, std::mt19937 &random)
{
    auto pick = [&random](size_t n) { return n == 0 ? size_t{0} : std::uniform_int_distribution<size_t>(0, n - 1)(random); };
    int steps = 1 + static_cast<int>(pick(4));
    for (int step = 0; step < steps; ++step) {
        switch (pick(6)) {
        case 0:  // flip a bit
            if (!input.empty())
                input[pick(input.size())] ^= static_cast<uint8_t>(1u << pick(8));
            break;
        case 1:  // a random byte
            if (!input.empty())
                input[pick(input.size())] = static_cast<uint8_t>(random());
            break;
        case 2: {  // an edge value in a word, either byte order
            if (input.size() < 4)
                break;
            uint32_t value = kInteresting[pick(std::size(kInteresting))];
            size_t width = pick(2) == 0 ? 2 : 4, at = pick(input.size() - width + 1);
            bool big = pick(2) == 0;
            for (size_t i = 0; i < width; ++i)
                input[at + i] = static_cast<uint8_t>(value >> (8 * (big ? width - 1 - i : i)));
            break;
        }
        case 3:  // cut the end off
            input.resize(pick(input.size() + 1));
            break;
        case 4: {  // insert a few bytes
            size_t at = pick(input.size() + 1), n = 1 + pick(8);
            input.insert(input.begin() + static_cast<std::ptrdiff_t>(at), n, static_cast<uint8_t>(random()));
            break;
        }
        default:  // erase a few bytes
            if (!input.empty()) {
                size_t at = pick(input.size()), n = std::min(input.size() - at, 1 + pick(8));
                input.erase(input.begin() + static_cast<std::ptrdiff_t>(at),
                            input.begin() + static_cast<std::ptrdiff_t>(at + n));
            }
        }
    }
}

}  // namespace

int main(int argc, char **argv)
{
    unsigned long runs = 2000, seed = 1;
    std::vector<Input> corpus;
    for (int i = 1; i < argc; ++i) {
        if (std::strncmp(argv[i], "-runs=", 6) == 0) {
            runs = std::strtoul(argv[i] + 6, nullptr, 10);
        } else if (std::strncmp(argv[i], "-seed=", 6) == 0) {
            seed = std::strtoul(argv[i] + 6, nullptr, 10);
        } else if (argv[i][0] == '-') {
            continue;  // libFuzzer's other flags mean nothing here
        } else if (std::filesystem::is_directory(argv[i])) {
            std::vector<std::filesystem::path> files;
            for (const auto &entry : std::filesystem::directory_iterator(argv[i]))
                files.push_back(entry.path());
            std::sort(files.begin(), files.end());
            for (const auto &file : files)
                corpus.push_back(read_input(file));
        } else {
            corpus.push_back(read_input(argv[i]));
        }
    }
    if (corpus.empty())
        corpus.emplace_back();
    for (const Input &input : corpus)
        run(input);
    std::mt19937 random(static_cast<std::mt19937::result_type>(seed));
    for (unsigned long n = 0; n < runs; ++n) {
        Input input = corpus[random() % corpus.size()];
        mutate(input, random);
        run(input);
    }
    std::printf("replayed %zu corpus inputs and %lu mutations (seed %lu)\n", corpus.size(), runs, seed);
    return 0;
}
