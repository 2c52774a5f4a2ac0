// Runs a fuzzer's entry point on every file of a folder, and on each with some bytes damaged: what once
// mattered stays tested in every build.

#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const unsigned char* bytes, std::size_t size);

int main(int, char** argv) {
    bool isEmpty = true;
    const std::string digits = "0123456789{}[],\"\xff";
    for (const auto& entry : std::filesystem::directory_iterator(argv[1])) {
        std::mt19937 random(1);
        std::ifstream file(entry.path(), std::ios::binary);
        const std::string whole{std::istreambuf_iterator<char>(file), {}};
        for (int round = 0; round < 500; ++round) {
            std::string bytes = whole;
            for (int i = 0; i < round % 4; ++i) { // none in the first round
                const std::size_t at = random() % (bytes.size() + 1);
                random() % 2 == 0 ? bytes.erase(at, random() % 9)
                                  : bytes.insert(at, 1, digits[random() % digits.size()]);
            }
            LLVMFuzzerTestOneInput(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size());
        }
        isEmpty = false;
    }
    return isEmpty ? 1 : 0;
}
