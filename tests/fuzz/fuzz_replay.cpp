// Runs a fuzz target's entry point once for each file of the directories
// given, as libFuzzer does with files: the seeds and every input that once
// failed are replayed by the normal and sanitizer builds. A failing input
// aborts; the last "replay:" line names it.
#include <dirent.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv) {
    int inputs = 0;
    for (int i = 1; i < argc; ++i) {
        std::vector<std::string> names;
        DIR* dir = opendir(argv[i]);
        if (dir == nullptr) {
            fprintf(stderr, "replay: cannot open %s\n", argv[i]);
            return 1;
        }
        while (dirent* e = readdir(dir))
            if (e->d_name[0] != '.') names.push_back(e->d_name);
        closedir(dir);
        std::sort(names.begin(), names.end());
        for (const std::string& name : names) {
            std::string path = std::string(argv[i]) + "/" + name;
            printf("replay: %s\n", path.c_str());
            fflush(stdout);
            std::ifstream in(path, std::ios::binary);
            std::stringstream bytes;
            bytes << in.rdbuf();
            std::string input = bytes.str();
            LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(input.data()), input.size());
            ++inputs;
        }
    }
    printf("replay: %d inputs\n", inputs);
    return inputs > 0 ? 0 : 1;
}
