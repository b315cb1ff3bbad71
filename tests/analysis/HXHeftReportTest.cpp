// Whatever a machine is like, its report adds up.
#include "support/HXRun.h"

#include <cstdint>
#include <gtest/gtest.h>
#include <random>

namespace {
using Words = std::vector<std::string>;

// Machines of a few processes whose mappings meet in a handful of objects, in every state.
class RandomMachine {
  public:
    explicit RandomMachine(uint64_t seed) : _random(seed) {}

    std::string text() {
        std::string text = "host  ledger=page_table" + std::string(one(2) ? "  self_region_heft=0\n" : "\n");
        for (int pid = 1001; pid <= 1002 + static_cast<int>(below(4)); pid++)
            text += process(pid);
        return text;
    }
    Words arguments() {
        Words words{one(2) ? "-a" : "same"};
        for (const char *option : {"-v", "-w", "--vmObjectDirty", "--swapped", "--wired", "--unmapped", "-t"})
            if (one(4)) words.push_back(option);
        static const char *const columns[] = {"dirty", "swapped", "clean",   "reclaimable",
                                              "wired", "regions", "category"};
        words.insert(words.end(), {"--sort", columns[below(7)]});
        return words;
    }

  private:
    static constexpr uint64_t kPage = 16384;

    std::string process(int pid) {
        std::string text = field("process  pid=", pid) +
                           "  name=" + (pid == 1001 || one(2) ? "same" : "other") +
                           field("  flags=", one(4) ? 0 : 16) + field("  heft=", below(1000000)) +
                           field("  page_table=", below(3) * kPage) + (one(3) ? "  owned_none=1\n" : "\n");
        const bool ownsNothing = text.find("owned_none") != std::string::npos;
        for (uint64_t count = ownsNothing ? 0 : below(3); count > 0; count--)
            text += field("owned  pid=", pid) + field("  object_id=", 1 + below(6)) +
                    field("  virtual=", 4 * kPage) + field("  resident=", below(4) * kPage) +
                    field("  compressed=", below(2) * kPage) + field("  flags=", below(4) << 4) + "\n";
        text += field("image  pid=", pid) + "  path=/bin/x  base=0x7000000\n" + field("segment  pid=", pid) +
                "  name=__DATA  start=0x7000000  size=0x10000\n";
        uint64_t address = kPage;
        for (uint64_t count = below(12); count > 0; count--) {
            address += below(3) * kPage;
            const uint64_t pages = 1 + below(6);
            text += region(pid, address, pages * kPage, facts(pages));
            address += pages * kPage;
        }
        text += region(pid, 0x7000000, 4 * kPage,
                       "share_mode=1  object_id=8  resident=3  dirtied=" + std::to_string(below(3)));
        for (const uint64_t cache : {uint64_t{0x40000000}, uint64_t{0x180000000}})
            if (one(3)) text += region(pid, cache, 2 * kPage, "max_prot=3  object_id=9  pages=1*9,1*1");
        return one(8) ? text + field("fault  pid=", pid) + "  call=mach_vm_region_recurse  from=3  error=5\n"
                      : text;
    }
    // Of a mapping of that many pages. What it is called depends on its object alone.
    std::string facts(uint64_t pages) {
        static const char *const names[] = {
            "tag=87", "tag=2", "tag=3", "pager=1  path=/a/x", "pager=1  path=/b/x", "tag=30", "tag=240"};
        const uint64_t resident = below(pages + 1), dirtied = below(resident + 1),
                       object = below(std::size(names));
        std::string text = field("resident=", resident) + field("  dirtied=", dirtied) +
                           field("  swapped=", below(pages - resident + 1)) +
                           field("  reusable=", below(resident - dirtied + 1)) +
                           field("  share_mode=", 1 + below(7)) + field("  object_id=", object) + "  " +
                           names[object] + field("  offset=", below(3) * kPage);
        if (one(4)) text += field("  purge=", below(3));
        if (one(4)) text += "  wired=1";
        static const char *const dispositions[] = {"0", "1", "9", "0x10", "0x81", "0x801", "0x89"};
        text += "  pages=";
        for (uint64_t i = 0; i < pages; i++)
            text += std::string(i > 0 ? ",1*" : "1*") + dispositions[below(7)];
        return text;
    }
    static std::string field(const char *name, uint64_t value) { return name + std::to_string(value); }
    uint64_t below(uint64_t limit) { return _random() % limit; }
    bool one(uint64_t in) { return below(in) == 0; }

    std::mt19937_64 _random;
};
} // namespace

TEST(HXHeftReportTest, EveryReportAddsUp) {
    for (uint64_t seed = 1; seed <= 300 && !testing::Test::HasFailure(); seed++) {
        RandomMachine random(seed);
        const std::string machine = random.text();
        const Words arguments = random.arguments();
        SCOPED_TRACE("seed " + std::to_string(seed) + "\n" + machine);
        (void)report(machine, arguments);
    }
}

// Of so many objects that one thread writes while others work out what is to be written. The processes are
// all of one size, so that they come by pid, the highest first.
TEST(HXHeftReportTest, AReportThatSeveralThreadsMakeIsInOrder) {
    constexpr int processes = 600, regions = 8;
    std::string machine = "host  self_region_heft=1\n";
    for (int i = 0; i < processes; i++) {
        const int pid = 1000 + i;
        machine += "process  pid=" + std::to_string(pid) + "  name=p\n";
        for (int j = 0; j < regions; j++)
            machine += region(pid, 0x1000000u * (j + 1), 0x4000,
                              "share_mode=" + std::to_string(j == 0 ? 1 : 2) +
                                  "  object_id=" + std::to_string(j == 0 ? 1 + i / 2 : pid * 10 + j) +
                                  "  dirtied=1  resident=1");
    }
    const HXRun made = report(machine, {"-a"});
    size_t last = 0;
    for (int pid = 1000 + processes - 1; pid >= 1000; pid--) {
        const size_t place = made.out.find("\np [" + std::to_string(pid) + "]: ");
        ASSERT_NE(place, std::string::npos) << pid;
        ASSERT_GT(place, last) << pid;
        last = place;
    }
}
