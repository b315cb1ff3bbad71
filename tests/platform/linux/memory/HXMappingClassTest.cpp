// What a made-up /proc cannot show of it; the rest is in cases/linux-regions.txt.
#include "platform/linux/memory/HXMappingClass.h"

#include "platform/HXRegionTags.h"

#include <gtest/gtest.h>

TEST(HXMappingClass, NamedMemoryForWhichNoTagIsLeftIsAnonymous) {
    HXMapping mapping;
    mapping.flags = HXMappingReadable | HXMappingWritable;
    HXClassifyMapping(HXPathKindOf("[anon:arena]"), HXFileSystemKind::unknown, 0, 0, &mapping);
    EXPECT_EQ(mapping.tag, HXHostTagAnonymous);
}
