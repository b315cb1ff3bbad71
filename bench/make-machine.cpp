// Writes a made-up machine file to standard output: any number of processes, regions and objects that all
// share.
//
//   make-machine PROCESSES REGIONS-EACH SHARED-OBJECTS
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

int main(int argc, char *argv[]) {
    if (argc != 4) {
        fprintf(stderr, "usage: make-machine PROCESSES REGIONS-EACH SHARED-OBJECTS\n");
        return 1;
    }
    const uint64_t processes = strtoull(argv[1], nullptr, 10);
    const uint64_t regions = strtoull(argv[2], nullptr, 10);
    const uint64_t shared = strtoull(argv[3], nullptr, 10);
    constexpr uint64_t page = 4096;
    constexpr uint64_t size = 16 * page;
    uint64_t nextObject = shared + 1;
    printf("heft-machine 1\nhost\tpage_size=%" PRIu64
           "\tpid=1000000\tself_region_heft=0\tledger=page_table\tshared_region=0\n",
           page);
    for (uint64_t p = 0; p < processes; p++) {
        const uint64_t pid = p + 1;
        printf("process\tpid=%" PRIu64
               "\tcomm=worker\targs_path=/usr/bin/worker\theft=65536\tpage_table=8192\n",
               pid);
        for (uint64_t r = 0; r < regions; r++) {
            const uint64_t address = 0x10000 + r * 2 * size;
            printf("region\tpid=%" PRIu64 "\taddress=0x%" PRIx64 "\tsize=%" PRIu64, pid, address, size);
            // The objects that all share come first.
            if (r < shared && r < regions / 2)
                printf("\tfull_object_id=%" PRIu64 "\tshare_mode=4\tresident=16\tdirtied=16\ttag=103\n",
                       r + 1);
            else
                printf("\tfull_object_id=%" PRIu64 "\tresident=16\tdirtied=%" PRIu64 "\ttag=%d\n",
                       nextObject++, r % 17, r % 2 ? 101 : 100);
        }
    }
    return 0;
}
