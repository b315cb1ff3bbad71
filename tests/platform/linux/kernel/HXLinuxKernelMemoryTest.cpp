// The kernel's memory on made-up machines, of some files below proc/ and sys/. The cases are in
// tests/cases/linux-kernel.txt.
#include "platform/linux/kernel/HXKernelRecord.h"
#include "support/HXCaseFile.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <sstream>
#include <unistd.h>

namespace {

struct HXMadeUpKernel {
    // `files` as in a case. Its meminfo has the needed figures, all 0 but MemTotal, before those of `files`.
    explicit HXMadeUpKernel(const std::string &files) {
        std::map<std::string, std::string> texts = {
            {"proc/meminfo", "MemTotal: 1 kB\nSReclaimable: 0 kB\nSUnreclaim: 0 kB\nKernelStack: 0 kB\n"}};
        std::string path;
        for (const std::string &line : HXLinesOf(files)) {
            const size_t arrow = line.find(" -> ");
            if (line.starts_with("@ ") && arrow != std::string::npos)
                root.link(line.substr(2, arrow - 2), line.substr(arrow + 4));
            else if (line.starts_with("@ "))
                path = line.substr(2);
            else
                texts[path] += line + "\n";
        }
        for (const auto &[name, text] : texts)
            root.write(name, text);
    }
    std::string record() {
        const HXKernelRecord record(memory);
        std::ostringstream text;
        const auto kibibytes = [](uint64_t size) { return " " + std::to_string((size + 512) / 1024); };
        for (size_t i = 0; i < record.zones.size(); i++)
            text << "zone " << cut(record.zoneNames[i].mzn_name) << kibibytes(record.zones[i].mzi_cur_size)
                 << " dirty" << kibibytes(HXKernelRecord::dirtySize(record.zones[i])) << "\n";
        for (const mach_memory_info_record &site : record.records) {
            if (isFigure(site)) continue;
            text << (site.flags & VM_KERN_SITE_HIDE ? "hidden " : "") << nameOf(site) << kibibytes(site.size)
                 << "\n";
            const bool isCounter = (site.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_COUNTER;
            EXPECT_EQ((site.flags & VM_KERN_SITE_WIRED) == 0, isCounter) << text.str();
        }
        return text.str();
    }
    // The machine's figures, which are counters with names.
    std::string machine() {
        std::string text;
        for (const mach_memory_info_record &site : HXKernelRecord(memory).records)
            if (isFigure(site)) text += cut(site.name) + " " + std::to_string(site.mapped / 1024) + "\n";
        return text;
    }
    // `what`: an address, or a function that is known by name alone.
    std::string symbol(const std::string &what) {
        const uint64_t address = what.ends_with(']') ? siteOf(what) : std::stoull(what, nullptr, 16);
        const std::unique_ptr<RVSymbolicator> at(
            memory.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(0, nullptr));
        const char *const name = memory.RVSymbolicatorGetSymbolWithAddressAtTime(at.get(), address, 0).name;
        const auto source = memory.RVSymbolicatorGetSourceInfoWithAddressAtTime(at.get(), address, kRVNow);
        return std::string(name ? name : "-") + " " +
               (source.isNull ? "-" : source.path + (":" + std::to_string(source.lineNumber)));
    }

    HXTemporaryFolder root;
    HXLinuxKernelMemory memory{root / "proc", root / "sys", 4096};

  private:
    static bool isFigure(const mach_memory_info_record &site) {
        return site.flags == (VM_KERN_SITE_COUNTER | VM_KERN_SITE_NAMED);
    }
    template <size_t size>
    static std::string cut(const char (&name)[size]) {
        return {name, strnlen(name, size)};
    }
    // Of "FUNCTION" or "FUNCTION [MODULE]".
    static uint64_t siteOf(const std::string &name) {
        const size_t module = name.find(" [");
        if (module == std::string::npos) return HXKernelSiteForFunction(name, "");
        return HXKernelSiteForFunction(name.substr(0, module),
                                       name.substr(module + 2, name.size() - module - 3));
    }
    std::string nameOf(const mach_memory_info_record &site) {
        const uint64_t type = site.flags & VM_KERN_SITE_TYPE;
        EXPECT_LT(site.site, uint64_t{1} << 53) << "a number of a JSON document";
        if (type == VM_KERN_SITE_TAG) return "tag " + std::to_string(site.site);
        if (type == VM_KERN_SITE_COUNTER) return "count " + std::to_string(site.site);
        if (type == VM_KERN_SITE_KMOD)
            for (const OSKextInfo &module : memory.OSKextCopyLoadedKextInfo())
                if (module.OSBundleLoadTag == site.site)
                    return "module " + module.CFBundleIdentifier.value_or("-");
        const std::string name = cut(site.name);
        const bool isWhole =
            name != "vmalloc" && !name.starts_with("site ") && name.size() < sizeof site.name;
        return isWhole && site.site != siteOf(name) ? "wrong number of " + name : name;
    }
};

TEST(HXLinuxKernelMemory, TellsWhatEachCaseExpects) {
    for (const HXCase &each : HXReadCases("linux-kernel.txt"))
        for (const auto &[label, expected] : each.expected) {
            HXMadeUpKernel kernel(each.input);
            const auto told = [&, kind = label, answers = expected] {
                if (kind == "record") return kernel.record();
                if (kind == "machine") return kernel.machine();
                return HXAnswered(answers, [&](const auto &question) { return kernel.symbol(question); });
            };
            EXPECT_EQ(told(), expected) << each.title;
        }
}

TEST(HXLinuxKernelMemory, TakesBackWhatItHandedOut) {
    HXMadeUpKernel kernel("@ proc/meminfo\nSUnreclaim: 4 kB\n");
    mach_zone_name *names = nullptr;
    mach_zone_info *zones = nullptr;
    mach_memory_info_record *sites = nullptr;
    uint32_t nameCount = 0, count = 0;
    kernel.memory.mach_memory_info(0, &names, &nameCount, &zones, &count, &sites, &count);
    ASSERT_EQ(nameCount, 1u);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, 1), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, sizeof *names), KERN_SUCCESS);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, sizeof *names), KERN_INVALID_ADDRESS);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, nullptr, 1), KERN_SUCCESS);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, 0), KERN_SUCCESS);
}

TEST(HXLinuxKernelMemory, MissingRightsAndFiguresAreErrors) {
    HXMadeUpKernel kernel("");
    const auto error = [&] { return HXKernelRecord(kernel.memory).error; };
    EXPECT_EQ(error(), KERN_SUCCESS);
    const uid_t user = geteuid();
    constexpr uid_t nobody = 65534;
    for (const char *denied : {"proc/slabinfo", "proc/vmallocinfo"}) {
        kernel.root.write(denied, "");
        std::filesystem::permissions(kernel.root / denied, std::filesystem::perms::none);
        ASSERT_EQ(seteuid(user == 0 ? nobody : user), 0);
        EXPECT_EQ(error(), KERN_NO_ACCESS) << denied;
        ASSERT_EQ(seteuid(user), 0);
        kernel.root.remove(denied);
    }
    kernel.root.write("proc/meminfo", "MemTotal: 1000 kB\nSReclaimable: 4 kB\nKernelStack: 16 kB\n");
    EXPECT_EQ(error(), KERN_FAILURE);
    kernel.root.remove("proc/meminfo");
    EXPECT_EQ(error(), KERN_FAILURE);
}

} // namespace
