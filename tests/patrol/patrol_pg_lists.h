// The two writers' preset lists of the concurrent-save test.
#ifndef TESTS_PATROL_PATROL_PG_LISTS_H
#define TESTS_PATROL_PATROL_PG_LISTS_H

#include <string>
#include <utility>
#include <vector>

#include "patrol/patrol.h"

namespace writerlists {

constexpr int kLength = 8;

// Writer A: positions 1..8 named A1..A8; writer B: 8..1 named B8..B1.
inline std::vector<std::pair<int, std::string>> List(char writer) {
    std::vector<std::pair<int, std::string>> out;
    for (int i = 0; i < kLength; ++i) {
        const int position = writer == 'A' ? i + 1 : kLength - i;
        out.emplace_back(position, std::string(1, writer) + std::to_string(position));
    }
    return out;
}

inline std::vector<std::pair<int, std::string>> Read(const Patrol& p) {
    std::vector<std::pair<int, std::string>> out;
    for (int i = 0; i < p.GetPresetListNum(); ++i) {
        PRESET_INFO info;
        p.GetPresetFromList(i, &info);
        out.emplace_back(info.position, info.name);
    }
    return out;
}

inline bool IsWholeList(const Patrol& p) {
    const auto read = Read(p);
    return read == List('A') || read == List('B');
}

inline void Fill(Patrol& p, char writer) {
    p.DelAllPreset();
    for (const auto& [position, name] : List(writer)) p.AddPresetToList({position, name});
}

}  // namespace writerlists

#endif  // TESTS_PATROL_PATROL_PG_LISTS_H
