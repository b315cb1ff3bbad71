#include "process/HXImage.h"

void HXImage::setName(HXString name) {
    _name = name;
    const std::string &text = name.str();
    if (text.starts_with("__TEXT"))
        _segment = HXSegmentText;
    else if (text.starts_with("__LINKEDIT"))
        _segment = HXSegmentLinkedit;
    else if (text.starts_with("__"))
        _segment = HXSegmentData;
}
