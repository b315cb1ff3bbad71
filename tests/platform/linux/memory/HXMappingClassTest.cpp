// How mappings are classified is in tests/cases/linux-regions.txt; here is what no process can show.
#include "platform/linux/memory/HXMappingClass.h"

#include "platform/HXRegionTags.h"

#include <gtest/gtest.h>

TEST(HXMappingClass, NamedMemoryForWhichNoTagIsLeftIsAnonymous) {
    HXMapping mapping;
    mapping.flags = HXMappingReadable | HXMappingWritable;
    HXClassifyMapping(HXPathKindOf("[anon:arena]"), HXFileSystemKind::unknown, 1, 0, &mapping);
    EXPECT_EQ(mapping.tag, HXHostTagAnonymous);
}
