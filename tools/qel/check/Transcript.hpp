#pragma once

#include <cstddef>
#include <deque>
#include <string>

namespace qel::tool::check {

/// One thing that happened on a connection of a case.
struct Event {
    enum class Kind { Sent, Seen, Note };

    unsigned int wire = 0; ///< number of the connection within the case, from 1
    Kind kind = Kind::Note;
    std::string text;   ///< the bytes; of a note, its words
    std::string remark; ///< to bytes: how they were sent; empty: in one piece
};

/// What happened in one case, in order. The first events and the newest are kept: a case may send a hundred thousand
/// frames. Thread safety: one thread.
class Transcript {
public:
    static constexpr std::size_t kFirst = 12;
    static constexpr std::size_t kLast = 36;

    void add(Event event);

    const std::deque<Event>& first() const noexcept { return mFirst; }
    const std::deque<Event>& last() const noexcept { return mLast; }
    /// How many there were between the two.
    std::size_t omitted() const noexcept { return mOmitted; }

private:
    std::deque<Event> mFirst;
    std::deque<Event> mLast;
    std::size_t mOmitted = 0;
};

/// The events in two columns: what was sent on the left, what was seen on the right, each frame decoded. Connections
/// are numbered when there are several.
/// @param hex  the bytes of each frame follow it
std::string transcriptText(const Transcript& transcript, bool hex);

} // namespace qel::tool::check
