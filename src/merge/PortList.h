// Ports in the order they were given, duplicates kept: positions matter. Relies on nothing. Promises: what counts up
// or down by one takes the room of one entry, so that a rule of every port is no larger than a rule of one.
#pragma once

#include <cstddef>
#include <initializer_list>
#include <iterator>
#include <vector>

namespace tavo::lib {

class PortList {
    struct Run {
        int nFirst;
        int nLast;  // above nFirst: it counts up; below: down

        int Step() const { return nLast < nFirst ? -1 : 1; }
    };

public:
    class const_iterator {
    public:
        using iterator_category = std::forward_iterator_tag;
        using value_type = int;
        using difference_type = std::ptrdiff_t;
        using pointer = const int*;
        using reference = int;

        const_iterator() = default;
        int operator*() const { return mNPort; }
        const_iterator& operator++() {
            if (mNPort != mPRun->nLast) {
                mNPort += mPRun->Step();
            } else if (++mPRun != mPEnd) {
                mNPort = mPRun->nFirst;
            }
            return *this;
        }
        const_iterator operator++(int) {
            const const_iterator before = *this;
            ++*this;
            return before;
        }
        bool operator==(const const_iterator& other) const {
            return mPRun == other.mPRun && (mPRun == mPEnd || mNPort == other.mNPort);
        }

    private:
        friend class PortList;
        const_iterator(const Run* pRun, const Run* pEnd)
            : mPRun(pRun), mPEnd(pEnd), mNPort(pRun == pEnd ? 0 : pRun->nFirst) {}

        const Run* mPRun = nullptr;
        const Run* mPEnd = nullptr;
        int mNPort = 0;
    };

    PortList() = default;
    PortList(std::initializer_list<int> ports) : PortList(ports.begin(), ports.end()) {}
    template <typename Iterator>
    PortList(Iterator it, Iterator end) {
        for (; it != end; ++it) {
            push_back(*it);
        }
    }

    void push_back(int nPort);
    // nLow to nHigh, counting up.
    void AppendRange(int nLow, int nHigh);

    size_t size() const { return mNSize; }
    bool empty() const { return mNSize == 0; }
    const_iterator begin() const { return {mRgRuns.data(), mRgRuns.data() + mRgRuns.size()}; }
    const_iterator end() const { return {mRgRuns.data() + mRgRuns.size(), mRgRuns.data() + mRgRuns.size()}; }
    bool operator==(const PortList& other) const;

private:
    std::vector<Run> mRgRuns;
    size_t mNSize = 0;
};

}  // namespace tavo::lib
