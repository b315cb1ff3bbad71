#include "platform/linux/memory/HXLocalMounts.h"

#include "platform/linux/procfs/HXProcText.h"

#include <gtest/gtest.h>

#include <string>

namespace {

const std::string kHost = "1 0 254:1 / / rw - ext4 /dev/vda rw\n"
                          "2 1 0:40 / /home rw - nfs4 server:/home rw\n"
                          "3 1 0:41 / /run rw - tmpfs none rw\n"
                          "4 1 0:42 / /var/lib/images rw - fuse.layers none rw\n"
                          "5 1 0:43 / /mnt rw - nfs4 server:/ rw\n"
                          "6 5 0:44 / /mnt rw - btrfs /dev/vdb rw\n";

TEST(HXLocalMounts, AreToldFromTheirTables) {
    constexpr uint32_t overlay = HXDeviceNumber(0, 50);
    const auto container = [](const std::string &options) {
        return "90 89 0:50 / / rw - overlay overlay rw," + options +
               "\n91 90 0:51 / /data rw - tmpfs none rw\n";
    };
    const struct {
        std::string table;
        uint32_t device;
        std::optional<uint64_t> mount;
        bool isRoots, expected;
    } cases[] = {
        {kHost, HXDeviceNumber(254, 1), {}, false, true},
        {kHost, HXDeviceNumber(254, 2), {}, true, false}, // in no table
        {kHost, HXDeviceNumber(0, 40), {}, true, false},
        {kHost, HXDeviceNumber(0, 44), 6, false, true},
        {kHost, HXDeviceNumber(0, 44), 5, true, false},
        {container("lowerdir=/a:/b,upperdir=/run/u,workdir=/home/w"), overlay, 90, true, true},
        {container("lowerdir=/a:/b,upperdir=/run/u"), overlay, 90, false, false}, // anybody's
        {container("lowerdir=/a:/home/b"), overlay, {}, true, false},
        {container("lowerdir=/homes/b::/c"), overlay, {}, true, true},
        {container("lowerdir=/a,upperdir=/home"), overlay, {}, true, false},
        {container("lowerdir=/var/lib/images/a"), overlay, {}, true, false},
        {container("lowerdir+=/a,datadir+=/home/b"), overlay, {}, true, false},
        {container("lowerdir+=/a,datadir+=/mnt/b"), overlay, {}, true, true},
        {container("lowerdir=/data/a"), overlay, {}, true, true},
        {container("lowerdir=a:/b"), overlay, {}, true, false},
        {container("lowerdir=/a/../home/b"), overlay, {}, true, false},
        {container("lowerdir=/a\\072b"), overlay, {}, true, false},
        {container("index=off"), overlay, {}, true, false},
    };
    for (const auto &item : cases)
        EXPECT_EQ(HXIsLocalMount({item.table, item.isRoots, kHost}, item.device, item.mount), item.expected)
            << item.table;
}

} // namespace
