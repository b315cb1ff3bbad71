// What a set holds, from what its members see of it.
#include "report/HXReport.h"

#include <algorithm>

namespace {

using Number = HXReport::Number;

constexpr uint64_t HXReportSizes::*kSizes[] = {&HXReportSizes::heft, &HXReportSizes::swapped,
                                               &HXReportSizes::clean, &HXReportSizes::reclaimable,
                                               &HXReportSizes::wired};

// One category of one set: each size is at least the largest view's and at most the sum of them.
struct Range {
    Number set;
    Number category;
    HXReportSizes least;
    HXReportSizes most;
};

std::vector<Range> rangesOfViews(const HXReport &report) {
    std::vector<Range> ranges;
    std::vector<size_t> position(report.categories().size()); // in ranges, of this set's
    for (Number set = 0; set < report.setCount(); set++) {
        const auto [first, last] = report.viewsOfSet(set);
        if (!report.rows(set).empty()) continue; // somebody sees the whole
        const size_t start = ranges.size();
        for (size_t i = first; i < last; i++) {
            for (const HXReport::Row &row : report.view(i).rows) {
                size_t &at = position[row.category];
                if (at < start || at >= ranges.size() || ranges[at].category != row.category) {
                    at = ranges.size();
                    ranges.push_back({set, row.category, {}, {}});
                }
                for (const auto size : kSizes)
                    ranges[at].least.*size = std::max(ranges[at].least.*size, row.sizes.*size);
                ranges[at].most += row.sizes;
            }
        }
    }
    return ranges;
}

uint64_t less(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
}

} // namespace

void HXReport::estimateSetsFromViews() {
    const std::vector<Range> ranges = rangesOfViews(*this);
    // By category: what the summary leaves for the sets with views, and what these have at least and at most.
    std::vector<HXReportSizes> left(_categories.size());
    std::vector<HXReportSizes> least(_categories.size());
    std::vector<HXReportSizes> most(_categories.size());
    for (const Row &row : _summary)
        left[row.category] += row.sizes;
    for (Number set = 0; set < _sets.size(); set++)
        for (const Row &row : rows(set))
            for (const auto size : kSizes)
                left[row.category].*size = less(left[row.category].*size, row.sizes.*size);
    for (const Range &range : ranges) {
        least[range.category] += range.least;
        most[range.category] += range.most;
    }
    std::vector<Row> estimated;
    for (size_t i = 0; i < ranges.size(); i++) {
        const Range &range = ranges[i];
        Row row{range.category, range.least};
        for (const auto size : kSizes) {
            const uint64_t spread = less(most[range.category].*size, least[range.category].*size);
            const uint64_t toGive =
                std::min(spread, less(left[range.category].*size, least[range.category].*size));
            if (spread != 0)
                row.sizes.*size += static_cast<uint64_t>(static_cast<long double>(toGive) *
                                                         (range.most.*size - range.least.*size) / spread);
        }
        row.sizes.regions = range.most.regions;
        estimated.push_back(row);
        if (i + 1 == ranges.size() || ranges[i + 1].set != range.set) {
            addRows(range.set, estimated);
            estimated.clear();
        }
    }
}
