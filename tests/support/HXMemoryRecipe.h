// Ways to have memory, as data: what a live process maps and does to it, and what must be told of that.
#pragma once

#include <cstddef>
#include <cstdint>
#include <ostream>
#include <vector>

// Something done to pages of a mapping: an advice of madvise(2), one of HXMemoryAct, or HXActProtect less the
// PROT_… bits that the pages get.
struct HXMemoryStep {
    int act;
    size_t first = 0;
    size_t count = 0; // 0: all that follow
    size_t every = 1; // 2: to the first, the third, …
};
enum HXMemoryAct { HXActLock = -1, HXActRunThread = -2, HXActProtect = -3 };

struct HXMemoryMapping {
    size_t pages;
    int protection; // PROT_…
    int flags;      // MAP_…
    // A file to map, "memfd", "SysV", or a folder for a file without a name; null: none. One of a kind in a
    // recipe.
    const char *file;
    std::vector<HXMemoryStep> steps;
    // The region's name and pages; no name: only as the kernel's files say.
    const char *name = nullptr;
    size_t dirty = 0, clean = 0, reclaimable = 0;
    bool wired = false;
    size_t offset = 0; // pages
};
struct HXMemoryRecipe {
    const char *name;
    std::vector<HXMemoryMapping> mappings;

    friend void PrintTo(const HXMemoryRecipe &recipe, std::ostream *out) { *out << recipe.name; }
};

// Whether /dev/shm is a tmpfs, as it is on most machines but not in every container.
bool HXHasTmpfs();

// Does all that the calling process needs for it; ends it when the machine cannot.
void HXFollow(const HXMemoryRecipe &recipe);
// Where the mapping of that index begins.
uint64_t HXPlaceOf(const HXMemoryRecipe &recipe, size_t index);
