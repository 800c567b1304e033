// IC::detail::FlatIndex: the node store's hash index of fixed-size slots.
//
// Open addressing with linear probing over a power-of-two array kept at
// most half full: a look-up reads one slot (and its neighbours) where a
// node-based table reads a bucket, the node before the match and the match.
// Removal moves the slots after the removed one back into place, so the
// index never fills with tombstones and needs no rebuild.
//
// Slot requirements: default-constructed means free; bool empty() const;
// std::uint32_t hash() const, well mixed in its upper bits (the home slot
// is taken from them).
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace IC {
namespace detail {

template <class Slot>
class FlatIndex {
public:
    std::size_t size() const { return count; }

    // The first slot from h's home on that match accepts; null if none does.
    template <class Match>
    Slot* find(std::uint32_t h, Match const& match)
    {
        if (slots.empty())
            return nullptr;
        for (std::size_t i = home(h);; i = next(i)) {
            Slot& s = slots[i];
            if (s.empty())
                return nullptr;
            if (match(s))
                return &s;
        }
    }
    template <class Match>
    Slot const* find(std::uint32_t h, Match const& match) const
    {
        return const_cast<FlatIndex*>(this)->find(h, match);
    }

    // Enters slot, which no slot may match yet; earlier slot addresses are
    // invalid afterwards.
    void insert(Slot const& slot)
    {
        if ((count + 1) * 2 > slots.size())
            grow();
        place(slot);
        ++count;
    }

    void erase(Slot* removed)
    {
        std::size_t hole = static_cast<std::size_t>(removed - slots.data());
        for (std::size_t j = next(hole); !slots[j].empty(); j = next(j)) {
            // A slot stays where it is while its home lies after the hole
            // (cyclically), up to and including its own place.
            std::size_t const k = home(slots[j].hash());
            bool const stays = hole < j ? hole < k && k <= j : hole < k || k <= j;
            if (!stays) {
                slots[hole] = slots[j];
                hole = j;
            }
        }
        slots[hole] = Slot();
        --count;
    }

    void clear()
    {
        std::vector<Slot>().swap(slots);
        count = 0;
    }

    template <class Visit>
    void forEach(Visit const& visit) const
    {
        for (Slot const& s : slots)
            if (!s.empty())
                visit(s);
    }

private:
    std::size_t next(std::size_t i) const { return (i + 1) & (slots.size() - 1); }
    std::size_t home(std::uint32_t h) const { return h >> shift; }

    void place(Slot const& slot)
    {
        std::size_t i = home(slot.hash());
        while (!slots[i].empty())
            i = next(i);
        slots[i] = slot;
    }

    void grow()
    {
        std::vector<Slot> old(slots.empty() ? 16 : slots.size() * 2);
        old.swap(slots);
        shift = 32;
        for (std::size_t n = slots.size(); n > 1; n >>= 1)
            --shift;
        for (Slot const& s : old)
            if (!s.empty())
                place(s);
    }

    std::vector<Slot> slots;
    std::size_t count = 0;
    unsigned int shift = 32;
};

} // namespace detail
} // namespace IC
