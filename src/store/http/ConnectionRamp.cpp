#include "store/http/ConnectionRamp.h"

#include <algorithm>

namespace rolvane {

int ConnectionRamp::allowed() const {
    const bool isFar = _judged >= _pace.answersToJudge && _quickest >= _pace.far;
    return isFar ? _most : std::min(_ramped, _most);
}

void ConnectionRamp::answered(Steady now, Seconds waited) {
    _quickest = std::min(_quickest.value_or(waited), waited);
    _judged = std::min(_judged + 1, _pace.answersToJudge);
    _moved = now;
    _patience = _pace.firstPatience;
    if (++_answers < _pace.answersForOneMore) return;
    _answers = 0;
    _ramped = std::min(_ramped + 1, _most);
}

void ConnectionRamp::othersWait(Steady now) {
    if (!_moved) _moved = now;
    if (now - *_moved < _patience) return;
    _moved = now;
    _patience = std::min(_patience * 2, _pace.longestPatience);
    _ramped = std::min(_ramped + 1, _most);
}

void ConnectionRamp::closed() {
    _ramped = _pace.first;
    _answers = 0;
    _moved.reset();
    _patience = _pace.firstPatience;
}

} // namespace rolvane
