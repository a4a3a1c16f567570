// In place of the fuzzing engine: gives the files in the folders of the command line to the target,
// one after the other.
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

int main(int argc, char** argv) {
    int inputs = 0;
    for (int i = 1; i < argc; ++i) {
        for (const auto& entry : std::filesystem::directory_iterator{argv[i]}) {
            std::cout << entry.path().string() << std::endl;  // a failure ends the program
            std::ifstream file{entry.path(), std::ios::binary};
            const std::string input{std::istreambuf_iterator<char>{file}, {}};
            LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(input.data()),
                                   input.size());
            ++inputs;
        }
    }
    return inputs > 0 ? 0 : 1;
}
