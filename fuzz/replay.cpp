/// In place of libFuzzer, with a compiler that lacks it. Usage: fuzz-TARGET FOLDER...
/// Gives the target each file of the folders once.

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

int main(int count, char** arguments)
{
    int inputs = 0;
    for (int i = 1; i < count; ++i) {
        for (const auto& file : std::filesystem::directory_iterator(arguments[i])) {
            std::fprintf(stderr, "%s\n", file.path().c_str()); // a finding ends the program
            std::ifstream input(file.path(), std::ios::binary);
            const std::string text(std::istreambuf_iterator<char>(input), {});
            LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
            ++inputs;
        }
    }
    std::fprintf(stderr, "%d inputs\n", inputs);
    return inputs == 0 ? 1 : 0;
}
