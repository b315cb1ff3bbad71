// What the live host tells of a stopped process, against the kernel's own files, to the byte.
#include "analysis/HXHeft.h"
#include "platform/HXPlatform.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "process/HXProcessSnapshot.h"
#include "process/HXUserProcess.h"
#include "support/HXSubject.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <sys/ipc.h>
#include <sys/mman.h>
#include <sys/shm.h>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>

namespace {

constexpr uint64_t kPage = 4096;
constexpr uint64_t kMiB = 1 << 20;
// Far from all that a process maps by itself, so that the kernel merges nothing with the mappings below.
char *const kPlace = reinterpret_cast<char *>(0x7ea000000000);

char *mapAt(char *place, uint64_t size, int protection, int flags, int file = -1, off_t offset = 0) {
    void *mapped = mmap(place, size, protection, flags | MAP_FIXED_NOREPLACE, file, offset);
    if (mapped == MAP_FAILED) {
        perror("mmap");
        _exit(1);
    }
    return static_cast<char *>(mapped);
}

HXExpectedRegion expect(const char *start, uint64_t size, const char *name, uint64_t dirty,
                        uint64_t clean = 0, uint64_t reclaimable = 0, bool wired = false) {
    HXExpectedRegion region{.start = reinterpret_cast<uint64_t>(start),
                            .size = size,
                            .dirtySize = dirty,
                            .cleanSize = clean,
                            .reclaimableSize = reclaimable,
                            .wired = wired};
    snprintf(region.name, sizeof region.name, "%s", name);
    return region;
}

int unlinkedFile(const std::string &folder, uint64_t size, bool keepName) {
    std::string path = folder + "/heft-test-XXXXXX";
    const int file = mkstemp(path.data());
    if (file < 0 || ftruncate(file, static_cast<off_t>(size)) != 0) _exit(1);
    const std::string content(size, 'x');
    if (pwrite(file, content.data(), content.size(), 0) != static_cast<ssize_t>(size)) _exit(1);
    if (!keepName) unlink(path.c_str());
    return file;
}

constexpr int kPrivate = MAP_PRIVATE | MAP_ANONYMOUS;
constexpr int kShared = MAP_SHARED | MAP_ANONYMOUS;
constexpr int kReadWrite = PROT_READ | PROT_WRITE;

std::vector<HXExpectedRegion> plainAnonymous() {
    char *all = mapAt(kPlace, 8 * kMiB, kReadWrite, kPrivate);
    madvise(all, 8 * kMiB, MADV_NOHUGEPAGE);
    memset(all + kMiB, 1, kMiB);
    char *code = mapAt(kPlace + 16 * kMiB, 4 * kPage, kReadWrite | PROT_EXEC, kPrivate);
    code[0] = 1;
    return {expect(all, 8 * kMiB, "anonymous", kMiB), expect(code, 4 * kPage, "anonymous code", kPage)};
}

std::vector<HXExpectedRegion> reservations() {
    char *none = mapAt(kPlace, 64 * kMiB, PROT_NONE, kPrivate | MAP_NORESERVE);
    // Too large for the place of the others; by the system call itself, lest a sanitizer refuses the size.
    auto *huge = reinterpret_cast<char *>(
        syscall(SYS_mmap, nullptr, 1ULL << 40, kReadWrite, kPrivate | MAP_NORESERVE, -1, 0));
    madvise(huge, 1ULL << 40, MADV_NOHUGEPAGE);
    // Written by the kernel: the thread sanitizer knows nothing of that place.
    if (madvise(huge + (1ULL << 39), kMiB, MADV_POPULATE_WRITE) != 0) return {};
    return {expect(none, 64 * kMiB, "guard", 0), expect(huge, 1ULL << 40, "anonymous", kMiB)};
}

std::vector<HXExpectedRegion> lazilyFreedAndLocked() {
    char *freed = mapAt(kPlace, 16 * kPage, kReadWrite, kPrivate);
    memset(freed, 1, 16 * kPage);
    if (madvise(freed, 4 * kPage, MADV_FREE) != 0) return {};
    char *locked = mapAt(kPlace + kMiB, 4 * kPage, kReadWrite, kPrivate);
    // By the system call: sanitizers make the function do nothing.
    if (syscall(SYS_mlock, locked, 4 * kPage) != 0) return {};
    return {expect(freed, 16 * kPage, "anonymous", 12 * kPage, 0, 4 * kPage),
            expect(locked, 4 * kPage, "anonymous", 4 * kPage, 0, 0, true)};
}

std::vector<HXExpectedRegion> transparentHugePages() {
    char *all = mapAt(kPlace, 8 * kMiB, kReadWrite, kPrivate);
    madvise(all, 8 * kMiB, MADV_HUGEPAGE);
    memset(all, 1, 4 * kMiB);
    return {expect(all, 8 * kMiB, "anonymous", 4 * kMiB)};
}

std::vector<HXExpectedRegion> manyMappings() {
    std::vector<HXExpectedRegion> expected;
    for (int i = 0; i < 2000; i++) {
        char *page = mapAt(kPlace + uint64_t(i) * 2 * kPage, kPage, kReadWrite, kPrivate);
        page[0] = 1;
        expected.push_back(expect(page, kPage, "anonymous", kPage));
    }
    return expected;
}

std::vector<HXExpectedRegion> fileMappings() {
    const int file = unlinkedFile("/var/tmp", 16 * kPage, false);
    char *copied = mapAt(kPlace, 16 * kPage, kReadWrite, MAP_PRIVATE, file);
    for (uint64_t i = 0; i < 3; i++)
        copied[i * kPage] = 'y';
    // The rest is read, so that it is resident and clean.
    madvise(copied, 16 * kPage, MADV_POPULATE_READ);
    char *shared = mapAt(kPlace + kMiB, 8 * kPage, kReadWrite, MAP_SHARED, file);
    madvise(shared, 8 * kPage, MADV_POPULATE_READ);
    shared[0] = 'z';
    return {expect(copied, 16 * kPage, "mapped file", 3 * kPage, 13 * kPage),
            expect(shared, 8 * kPage, "mapped file", 0, 8 * kPage)};
}

std::vector<HXExpectedRegion> tmpfsTwice() {
    const int file = unlinkedFile("/dev/shm", 16 * kPage, false);
    char *first = mapAt(kPlace, 8 * kPage, kReadWrite, MAP_SHARED, file);
    char *second = mapAt(kPlace + kMiB, 8 * kPage, kReadWrite, MAP_SHARED, file, 4 * kPage);
    madvise(first, 8 * kPage, MADV_POPULATE_READ);
    for (uint64_t i = 0; i < 6; i++) // reading would map the neighbours, too
        second[i * kPage] = 'y';
    return {expect(first, 8 * kPage, "deleted shared memory", 8 * kPage),
            expect(second, 8 * kPage, "deleted shared memory", 6 * kPage)};
}

std::vector<HXExpectedRegion> sharedMemory() {
    const int memfd = static_cast<int>(syscall(SYS_memfd_create, "heft test", 0));
    if (memfd < 0 || ftruncate(memfd, 16 * kPage) != 0) return {};
    char *shared = mapAt(kPlace, 16 * kPage, kReadWrite, MAP_SHARED, memfd);
    memset(shared, 1, 5 * kPage);
    char *copied = mapAt(kPlace + kMiB, 16 * kPage, kReadWrite, MAP_PRIVATE, memfd);
    madvise(copied, 5 * kPage, MADV_POPULATE_READ);
    copied[0] = 2;
    char *anonymous = mapAt(kPlace + 2 * kMiB, 16 * kPage, kReadWrite, kShared);
    memset(anonymous, 1, 7 * kPage);
    const int id = shmget(IPC_PRIVATE, 16 * kPage, IPC_CREAT | 0600);
    if (id < 0) return {};
    auto *systemV = static_cast<char *>(shmat(id, kPlace + 3 * kMiB, 0));
    shmctl(id, IPC_RMID, nullptr);
    memset(systemV, 1, 3 * kPage);
    return {expect(shared, 16 * kPage, "memfd", 5 * kPage), expect(copied, 16 * kPage, "memfd", 5 * kPage),
            expect(anonymous, 16 * kPage, "shared anonymous", 7 * kPage),
            expect(systemV, 16 * kPage, "System V shared memory", 3 * kPage)};
}

std::vector<HXExpectedRegion> namedMemory() {
    char *all = mapAt(kPlace, 4 * kPage, kReadWrite, kPrivate);
    memset(all, 1, 4 * kPage);
    constexpr int setVma = 0x53564d41; // PR_SET_VMA, prctl(2)
    if (syscall(SYS_prctl, setVma, 0, all, 4 * kPage, "my arena") != 0)
        return {expect(all, 4 * kPage, "anonymous", 4 * kPage)};
    return {expect(all, 4 * kPage, "my arena", 4 * kPage)};
}

// On a machine with swap, what the kernel takes out is told as swapped; elsewhere it stays.
std::vector<HXExpectedRegion> pagedOut() {
    char *own = mapAt(kPlace, kMiB, kReadWrite, kPrivate);
    madvise(own, kMiB, MADV_NOHUGEPAGE);
    char *shared = mapAt(kPlace + 2 * kMiB, kMiB, kReadWrite, kShared);
    char *part =
        static_cast<char *>(mremap(shared, 0, kMiB / 2, MREMAP_MAYMOVE | MREMAP_FIXED, kPlace + 4 * kMiB));
    for (char *each : {own, shared}) {
        memset(each, 1, kMiB / 2);
        memset(each + kMiB / 4, 2, kMiB / 8);
        madvise(each, kMiB / 4, MADV_PAGEOUT);
    }
    (void)part;
    return {};
}

std::vector<HXExpectedRegion> threadStack() {
    static char *stack;
    stack = mapAt(kPlace, kMiB, kReadWrite, kPrivate | MAP_STACK);
    madvise(stack, kMiB, MADV_NOHUGEPAGE);
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setstack(&attributes, stack, kMiB);
    pthread_t thread;
    static int ready[2];
    if (pipe(ready) != 0) return {};
    const auto run = [](void *) -> void * {
        if (write(ready[1], "", 1) == 1) pause();
        return nullptr;
    };
    if (pthread_create(&thread, &attributes, run, nullptr) != 0) return {};
    char byte;
    if (read(ready[0], &byte, 1) != 1) return {};
    return {expect(stack, kMiB, "stack", UINT64_MAX)};
}

std::vector<HXExpectedRegion> nothingSpecial() {
    static char bss[64 * kPage];
    memset(bss, 1, sizeof bss);
    auto *heap = static_cast<char *>(sbrk(16 * kPage));
    if (heap != reinterpret_cast<char *>(-1)) memset(heap, 1, 16 * kPage);
    return {};
}

struct Case {
    const char *name;
    std::vector<HXExpectedRegion> (*setUp)();
};

class HXLiveRegions : public testing::TestWithParam<Case> {
  protected:
    void SetUp() override { HXPlatform::setCurrent(&platform); }
    void TearDown() override { HXProcess::_clearGlobalErrors(); }

    std::unique_ptr<HXUserProcess> gathered(pid_t pid, bool breakDown) {
        HXHeft::setBreakDownPhysHeft(breakDown);
        HXProcessSnapshot snapshot;
        auto process = HXProcess::processWithPid(pid, snapshot);
        if (process) process->gatherData();
        return std::unique_ptr<HXUserProcess>(static_cast<HXUserProcess *>(process.release()));
    }

    HXLinuxPlatform platform;
};

const HXMemoryRegion *regionAt(const HXProcess &process, uint64_t start) {
    for (const HXMemoryRegion &region : process.memoryRegions())
        if (region.start() == start) return &region;
    return nullptr;
}

bool isSwapBacked(const HXSmapsEntry &entry) {
    static const std::vector<std::string> tmpfsFolders = {"/dev/shm/", "/memfd:", "/SYSV",
                                                          "/dev/zero (deleted)"};
    for (const std::string &folder : tmpfsFolders)
        if (entry.path.starts_with(folder)) return true;
    return entry.path.starts_with("[anon_shmem");
}

TEST_P(HXLiveRegions, AgreeWithTheKernelsFiles) {
    const HXSubject subject(GetParam().setUp);
    ASSERT_TRUE(subject.stopped());
    const auto process = gathered(subject.pid(), true);
    ASSERT_TRUE(process);
    EXPECT_TRUE(process->errors().empty());

    uint64_t charged = 0;
    for (const HXSmapsEntry &entry : HXReadSmaps(subject.pid())) {
        const HXMemoryRegion *region = regionAt(*process, entry.start);
        ASSERT_TRUE(region) << entry.path;
        EXPECT_EQ(region->end(), entry.end);
        const uint64_t shared = isSwapBacked(entry) ? entry.rss - entry.anonymous : 0;
        const uint64_t expected = entry.anonymous - entry.lazyFree + shared + entry.hugetlb;
        EXPECT_EQ(region->dirtySize(), expected) << entry.path << " at " << std::hex << entry.start;
        EXPECT_EQ(region->swappedSize(), entry.swap) << entry.path;
        EXPECT_EQ(region->reclaimableSize(), entry.lazyFree) << entry.path;
        EXPECT_EQ(region->cleanNonSpecSize(), entry.rss + entry.hugetlb - expected - entry.lazyFree)
            << entry.path;
        charged += expected + entry.swap;
        if (const HXRangeList *runs = region->subrangeList()) {
            const HXMemoryTotal sum = runs->sum();
            EXPECT_EQ(sum.dirty, region->dirtySize()) << entry.path;
            EXPECT_EQ(sum.swapped, region->swappedSize()) << entry.path;
            EXPECT_EQ(sum.clean, region->cleanNonSpecSize()) << entry.path;
            EXPECT_EQ(sum.reclaimable, region->reclaimableSize()) << entry.path;
        }
    }
    const HXMemoryRegion *pageTables = regionAt(*process, kNoAddress);
    ASSERT_TRUE(pageTables);
    EXPECT_EQ(pageTables->name().str(), "page table");
    EXPECT_EQ(pageTables->dirtySize(), HXReadStatus(subject.pid(), "VmPTE"));
    HXHeft::ProcessList none;
    EXPECT_EQ(HXHeft(std::move(none))._calculateHeftForProcess(*process), charged + pageTables->dirtySize());
    EXPECT_EQ(process->physHeft(),
              HXReadStatus(subject.pid(), "RssAnon") + HXReadStatus(subject.pid(), "RssShmem") +
                  HXReadStatus(subject.pid(), "VmSwap") + HXReadStatus(subject.pid(), "VmPTE") +
                  HXReadStatus(subject.pid(), "HugetlbPages"));
    EXPECT_GE(process->physHeftPeak(), process->physHeft());
}

TEST_P(HXLiveRegions, AreNamedAndSizedAsMapped) {
    const HXSubject subject(GetParam().setUp);
    ASSERT_TRUE(subject.stopped());
    const auto process = gathered(subject.pid(), true);
    ASSERT_TRUE(process);
    for (const HXExpectedRegion &expected : subject.expected()) {
        const HXMemoryRegion *region = regionAt(*process, expected.start);
        ASSERT_TRUE(region) << expected.name;
        EXPECT_EQ(region->size(), expected.size) << expected.name;
        EXPECT_EQ(region->name().str(), expected.name);
        if (expected.dirtySize == UINT64_MAX) continue; // as much as the thread used
        EXPECT_EQ(region->dirtySize(), expected.dirtySize) << expected.name;
        EXPECT_EQ(region->cleanNonSpecSize(), expected.cleanSize) << expected.name;
        EXPECT_EQ(region->reclaimableSize(), expected.reclaimableSize) << expected.name;
        EXPECT_EQ(region->wired(), expected.wired) << expected.name;
    }
}

TEST_P(HXLiveRegions, ShowDirtyPagesOfObjectsInTheOtherMode) {
    const HXSubject subject(GetParam().setUp);
    ASSERT_TRUE(subject.stopped());
    const auto process = gathered(subject.pid(), false);
    ASSERT_TRUE(process);
    for (const HXSmapsEntry &entry : HXReadSmaps(subject.pid())) {
        const HXMemoryRegion *region = regionAt(*process, entry.start);
        ASSERT_TRUE(region) << entry.path;
        const bool file =
            entry.path.starts_with("/") && !isSwapBacked(entry) && !entry.path.starts_with("/anon_hugepage");
        if (entry.path.starts_with("[v")) continue; // the kernel's own pages in the process
        const uint64_t expected = file ? entry.dirty : entry.rss + entry.hugetlb - entry.lazyFree;
        EXPECT_EQ(region->dirtySize(), expected) << entry.path;
    }
}

const Case cases[] = {
    {"PlainAnonymous", plainAnonymous},
    {"Reservations", reservations},
    {"LazilyFreedAndLocked", lazilyFreedAndLocked},
    {"TransparentHugePages", transparentHugePages},
    {"ManyMappings", manyMappings},
    {"FileMappings", fileMappings},
    {"TmpfsTwice", tmpfsTwice},
    {"SharedMemory", sharedMemory},
    {"NamedMemory", namedMemory},
    {"PagedOut", pagedOut},
    {"ThreadStack", threadStack},
    {"HeapAndBss", nothingSpecial},
};

INSTANTIATE_TEST_SUITE_P(Subjects, HXLiveRegions, testing::ValuesIn(cases),
                         [](const auto &each) { return each.param.name; });

} // namespace
