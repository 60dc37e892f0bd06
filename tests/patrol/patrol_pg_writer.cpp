// A second process for the concurrent-save test: loads one patrol, checks
// that the list it read is one writer's whole list, then saves its own list
// (by Save and SavePresetInfo in turn), round after round.
//   patrol_pg_writer PATROL_ID A|B ROUNDS
// Prints "loads=N torn=M failed=K" and exits 0 when it ran all rounds.
#include <cstdio>
#include <cstdlib>
#include <string>

#include "patrol/patrol.h"
#include "patrol_pg_lists.h"

int main(int argc, char** argv) {
    if (argc != 4) return 2;
    const int id = std::atoi(argv[1]);
    const char writer = argv[2][0];
    const int rounds = std::atoi(argv[3]);
    int loads = 0, torn = 0, failed = 0;
    for (int round = 0; round < rounds; ++round) {
        Patrol p;
        if (p.Load(id) != 0) {
            ++failed;
            continue;
        }
        ++loads;
        if (!writerlists::IsWholeList(p)) ++torn;
        writerlists::Fill(p, writer);
        if ((round % 2 == 0 ? p.Save() : p.SavePresetInfo()) != 0) ++failed;
    }
    std::printf("loads=%d torn=%d failed=%d\n", loads, torn, failed);
    return 0;
}
