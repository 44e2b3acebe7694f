// The mapping core against a model of a router, for months in a time that only the test moves. A seed chooses the
// router's habits, what happens, and when; the promises are checked after every pass.
//   test_model [SEEDS [FIRST]]   a seed that fails is printed with its last events
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <memory>
#include <optional>
#include <set>
#include <utility>

#include "mapping/Carry.h"
#include "mapping/Keeper.h"
#include "model_router.h"

namespace {

using tavo::MappingKey;
using tavo::RouterMapping;

constexpr int kEvents = 150;                 // of one life
constexpr int64_t kMostBetween = 3L * 3600;  // seconds from one event to the next
constexpr uint16_t kPorts = 12;
constexpr size_t kStory = 60;  // events that are told of a life that failed
constexpr char kStranger[] = "192.168.1.9";
// Passes after the last trouble (lost answers, a kill, a router that was away) by which everything is as it is to be:
// the first may still learn that an answer was lost, the second puts it right.
constexpr int kPassesToPeace = 2;

class Life {
public:
    explicit Life(unsigned nSeed) : mRandom(nSeed), mRouter(mRandom, mNNow) {
        model::Habits& habits = mRouter.habits;
        habits.blPermanentOnly = OneIn(5);
        habits.blForgetsLease = OneIn(6);
        habits.blListsWhatIsLeft = OneIn(2);
        habits.nLongestLease = OneIn(4) && !habits.blPermanentOnly ? 60U + Pick(7200) : 0;
        habits.nText = OneIn(2) ? 0 : static_cast<int>(Pick(3));
        habits.blSecure = OneIn(2);
        habits.blOverwrites = !OneIn(3);
        habits.nCapacity = OneIn(4) ? 4 + Pick(8) : 1000;
        habits.blSaysFull = OneIn(2);
        const tavo::Reply rgLists[] = {tavo::Reply::kOk,      tavo::Reply::kOk,      tavo::Reply::kOk,
                                       tavo::Reply::kTooLong, tavo::Reply::kRefused, tavo::Reply::kRefused};
        habits.enList = rgLists[Pick(6)];
        habits.blRanges = OneIn(3);
        habits.blRangesLie = OneIn(4);
        habits.blSaysChanged = OneIn(6);
        habits.blBlind = OneIn(4);
        habits.blSecure = habits.blSecure || habits.blBlind;
        habits.blForgetsLease = habits.blForgetsLease && !habits.blBlind;
        habits.blKeepsRemoved = OneIn(12) && !habits.blBlind;
        habits.blSlowToHide = OneIn(6) && !habits.blBlind;
        habits.blSlowToShow = OneIn(6) && !habits.blBlind;
        habits.blSlow = OneIn(6);
        if (OneIn(5)) {
            habits = {.blPermanentOnly = true, .nText = OneIn(2) ? 0 : 2, .blForm = true, .blMute = OneIn(3)};
            habits.blHidesClient = !habits.blMute && OneIn(3);
            habits.nCapacity = OneIn(4) ? 4 + Pick(8) : 1000;
            habits.blSaysFull = habits.blMute || OneIn(2);
            habits.blApply = OneIn(2);
        }
        // Nothing tells two routers apart whose lists leave out everything.
        mBlHardware = !OneIn(5) || habits.blHidesClient;
        mNCheck = OneIn(2) ? 120 : 600;
        mRouter.szBox = "192.168.1.5";
        mRouter.fnTell = [this](std::string szWhat) { Tell("  " + std::move(szWhat)); };
        mRouter.fnBeforeAdd = [this](const RouterMapping& mapping) { CheckOnRecord(tavo::KeyOf(mapping)); };
        Boot();
    }

    // Nothing: every promise was kept.
    std::optional<std::string> Live() {
        for (int i = 0; i < kEvents && mSzBroken.empty(); ++i) {
            Happen();
            const int64_t nUntil = mNNow + Pick(kMostBetween);
            while (mSzBroken.empty() && mNNext <= nUntil) {
                mNNow = std::max(mNNow, mNNext);
                RunPass();
            }
            mNNow = std::max(mNNow, nUntil);
        }
        return mSzBroken.empty() ? std::nullopt : std::optional(mSzBroken);
    }
    const std::deque<std::string>& Story() const { return mStory; }
    int64_t Seconds() const { return mNNow; }

private:
    unsigned Pick(int64_t nFrom) { return static_cast<unsigned>(mRandom() % static_cast<unsigned>(nFrom)); }
    bool OneIn(int64_t nTimes) { return Pick(nTimes) == 0; }
    void Tell(std::string szWhat) {
        mStory.push_back(std::to_string(mNNow) + " s: " + std::move(szWhat));
        if (mStory.size() > kStory) {
            mStory.pop_front();
        }
    }
    MappingKey AnyKey() { return {OneIn(2) ? "TCP" : "UDP", static_cast<uint16_t>(1 + Pick(kPorts))}; }

    // The process begins anew with what is on the disk, perhaps after a boot.
    void Start() {
        mPRecord = std::make_unique<tavo::Record>(mSzDisk, "boot " + std::to_string(mNBoots));
        mHabit = {};
        mKeeper = {};
        mMapLives.clear();
        mBlDoubtful = true;
        mNNext = mNNow;
        Trouble();
    }
    void Boot() {
        ++mNBoots;
        mNBootAt = mNNow;
        Start();
    }
    void Trouble() { mNPeace = 0; }
    static void Orphan(std::map<MappingKey, model::Router::Entry>& mapTable) {
        for (auto& [key, entry] : mapTable) {
            entry.blOrphan = entry.blOrphan || entry.blBox;
            entry.blBox = false;
        }
    }
    tavo::RouterName Name() const { return {mSzAddress, !mBlHardware ? "" : mBlOther ? "bb" : "aa"}; }

    // ---- what happens ------------------------------------------------------------------------------

    void Happen() {
        const bool blQuiet = std::exchange(mBlQuiet, false);
        switch (Pick(16)) {
            case 0:
            case 1:
            case 2:
                ChangeRules();
                break;
            case 3:
                mRouter.szBox = "192.168.1." + std::to_string(5 + Pick(3));
                Tell("own address " + mRouter.szBox);
                mNNext = mNNow;
                break;
            case 4:
                mRouter.Restart();
                Tell("router restarts");
                break;
            case 5:
                mRouter.blAway = !mRouter.blAway;
                Tell(mRouter.blAway ? "router away" : "router back");
                break;
            case 6:
                mRouter.nLosePerMille = mRouter.nLosePerMille == 0 ? 100 : 0;
                Tell("answers lost: " + std::to_string(mRouter.nLosePerMille));
                break;
            case 7:
                mRouter.nKillPerMille = 100;
                Tell("a kill comes");
                mNNext = mNNow;
                break;
            case 8:
                Boot();
                Tell("boot");
                break;
            case 9:
            case 10:
                Stranger();
                break;
            case 11:
                if (mBlHardware && OneIn(3)) {
                    mSzAddress = "192.168.1." + std::to_string(1 + Pick(2));
                    Tell("the router's address " + mSzAddress);
                    mNNext = mNNow;
                } else {
                    SwapRouters();
                }
                break;
            case 12:
                mBlDiskFull = !mBlDiskFull;
                Tell(mBlDiskFull ? "disk full" : "disk has room");
                break;
            case 13:
                // Of one that lies about a removal, too, a short listing would be the only witness.
                mRouter.nSkipPerMille = mRouter.nSkipPerMille == 0 && !mRouter.habits.blKeepsRemoved ? 200 : 0;
                Tell("entries left out of listings: " + std::to_string(mRouter.nSkipPerMille));
                break;
            case 14:
                mNStopIn = static_cast<int>(1 + Pick(60));
                Tell("a stop comes");
                ChangeRules();
                break;
            default:
                Tell("nothing");
                mBlQuiet = blQuiet;
                return;
        }
        Trouble();
    }

    void ChangeRules() {
        mRgWanted.clear();
        std::set<MappingKey> setKeys;
        for (unsigned i = Pick(8); i > 0; --i) {
            const MappingKey key = AnyKey();
            const auto nBoxPort = static_cast<uint16_t>(100 + Pick(mRouter.habits.blBlind ? 6 : 3));
            if (setKeys.insert(key).second) {
                mRgWanted.push_back({key.first, key.second, nBoxPort, "", OneIn(2) ? "tavo:a" : "tavo:b", 0, true});
            }
        }
        Tell(std::to_string(mRgWanted.size()) + " rules");
        mNNext = mNNow;
    }

    // What leads where ours was asked to lead, and was not shown yet, nobody can tell from it.
    static bool IsOnRecord(const tavo::Record& record, const RouterMapping& entry) {
        const auto it = record.Here().find(tavo::KeyOf(entry));
        return it != record.Here().end() && it->second.IsEntry(entry);
    }
    tavo::Record DiskRecord() const {
        tavo::Record disk(mSzDisk, "");
        disk.TurnTo(Name());
        return disk;
    }

    // Another host, or another program of this box, takes a place or leaves it.
    void Stranger() {
        const MappingKey key = AnyKey();
        const model::Router::Entry* pEntry = mRouter.At(key);
        if (pEntry == nullptr) {
            const std::string szClient = OneIn(2) ? kStranger : mRouter.szBox;
            const bool blBlind = mRouter.habits.blBlind || mRouter.habits.blMute || mRouter.habits.blHidesClient;
            const auto nBoxPort = static_cast<uint16_t>((OneIn(2) && !blBlind ? 100 : 200) + Pick(3));
            model::Router::Entry entry = {{key.first, key.second, nBoxPort, szClient, mRouter.TextOf("game"), 0, true}};
            entry.blOrphan = IsOnRecord(*mPRecord, entry.mapping) || IsOnRecord(DiskRecord(), entry.mapping);
            mRouter.mMapTable[key] = entry;
            Tell("stranger " + szClient + ":" + std::to_string(nBoxPort) + " takes " + key.first +
                 std::to_string(key.second));
        } else if (!pEntry->blBox && !pEntry->blOrphan) {
            mRouter.mMapTable.erase(key);
            Tell("stranger leaves " + key.first + std::to_string(key.second));
        }
    }

    // Another device at the gateway's address, and the first one again.
    void SwapRouters() {
        std::swap(mRouter.mMapTable, mMapOther);
        std::swap(mRouter.nLife, mNOtherLife);
        mBlOther = !mBlOther;
        if (!mBlHardware) {  // nothing tells one from the other
            Orphan(mRouter.mMapTable);
            Orphan(mMapOther);
        }
        Tell(mBlOther ? "other router" : "first router again");
        mNNext = mNNow;
    }

    // ---- a pass ----------------------------------------------------------------------------------------

    void RunPass() {
        const auto mapBefore = mRouter.mMapTable;
        mNPassAt = mNNow;
        const int nRequestsBefore = mRouter.nRequests;
        const int64_t nAllowance =
            mRouter.nLosePerMille + mRouter.nKillPerMille + mRouter.nSkipPerMille + (mRouter.blAway ? 1 : 0) + mNStopIn;
        if (mRouter.habits.blForm) {
            mPRecord = std::make_unique<tavo::Record>(mSzDisk, "boot " + std::to_string(mNBoots));
            mRouter.NewRun();
        }
        mPRecord->TurnTo(Name());
        mPRecord->Prune(mNNow - mNBootAt, mRouter.habits.blBlind);
        const tavo::Record recordBefore = *mPRecord;
        std::set<MappingKey> setLost = mHabit.setLost;
        mNAdds = 0;
        mHabit.nLease = mRouter.habits.blForm ? 0 : 3600;
        tavo::PassResult result;
        try {
            Ask();
            result = tavo::BringInLine(mRouter, mRgWanted, *mPRecord, mHabit,
                                       {mRouter.szBox, [this] { return mNNow - mNBootAt; },
                                        [this] { return mNStopIn > 0 && --mNStopIn == 0; }, [this] { return Save(); }});
        } catch (const model::Killed&) {
            mRouter.EndRun();
            mRouter.nKillPerMille = 0;
            mNStopIn = 0;
            Tell("killed");
            Start();
            CheckStrangers(mapBefore);
            return;
        }
        mRouter.EndRun();
        mRouter.nKillPerMille = 0;
        mNStopIn = 0;
        const bool blWell = result.transport.IsOk() && !result.blStopped;
        mBlDoubtful = mBlDoubtful || !result.transport.IsOk();
        mNNext = mNNow + SecondsToNext(result);
        mNPeace = nAllowance == 0 && blWell ? mNPeace + 1 : 0;
        CheckStrangers(mapBefore);
        // A slow router's lease may end while the pass goes on.
        std::set<MappingKey> setEnded;
        for (const auto& [key, before] : mapBefore) {
            if (before.nEnd != 0 && before.nEnd <= mNNow) {
                setEnded.insert(key);
            }
        }
        CheckWords(result, nAllowance != 0, setEnded);
        if (mNPeace >= kPassesToPeace) {
            setLost.merge(setEnded);
            CheckPeace(result, setLost);
        }
        if (mBlQuiet && nAllowance == 0 && mNAdds == 0 && mRouter.habits.enList == tavo::Reply::kOk) {
            CheckCost(result, mRouter.nRequests - nRequestsBefore, *mPRecord != recordBefore);
        } else {
            mBlAllOpen = false;
        }
        mBlQuiet = mBlQuiet || mNPeace >= kPassesToPeace;
    }

    // As the daemons have it.
    int SecondsToNext(const tavo::PassResult& result) {
        std::string szNow;
        for (const tavo::Outcome& outcome : result.rgOutcomes) {
            szNow += outcome.szName + outcome.verdict.szWord + (outcome.verdict.blAnew ? " anew" : "");
        }
        const bool blChange = std::exchange(mSzLast, std::move(szNow)) != mSzLast;
        return result.blStopped ? 0 : mKeeper.After(result, blChange, mNCheck).nSeconds;
    }

    // What was forgotten is forgotten again by the next process.
    bool HasNoRecord() const { return mRouter.habits.blForm && mBlDiskFull; }

    // What natpmpd learns of a blind router before it asks for anything.
    void Ask() {
        int nLife = 0;
        if (!mRouter.habits.blBlind) {
            return;
        }
        const bool blHeard = mRouter.Ask(nLife).IsOk();
        const auto it = mMapLives.find(Name().szHardware);
        const bool blRestarted = blHeard && it != mMapLives.end() && it->second != nLife;
        tavo::Forget(*mPRecord, mHabit, mRouter.szBox, blRestarted, mBlDoubtful, mNNow - mNBootAt);
        if (blHeard) {
            mMapLives[Name().szHardware] = nLife;
        }
        mBlDoubtful = !blHeard;
    }

    bool Save() {
        if (!mBlDiskFull && mSaved != *mPRecord) {
            mSaved = *mPRecord;
            mSzDisk = mSaved->Text();
        }
        return !mBlDiskFull;
    }

    // Every mapping is on record before the router is asked, and what cannot be put there is not asked for.
    void CheckOnRecord(const MappingKey& key) {
        ++mNAdds;
        if (!DiskRecord().Here().contains(key)) {
            Broken("asked for and not on record", key);
        }
    }

    // A pass over what is as it is to be costs one listing, and no write.
    void CheckCost(const tavo::PassResult& result, int nRequests, bool blWritten) {
        const bool blAllOpen =
            std::all_of(result.rgOutcomes.begin(), result.rgOutcomes.end(), [](const tavo::Outcome& outcome) {
                return outcome.verdict.enState == tavo::PortState::kOpen && !outcome.blLeftOver;
            });
        if (std::exchange(mBlAllOpen, blAllOpen) && blAllOpen && !mRouter.habits.blMute && !HasNoRecord() &&
            (nRequests != 1 || blWritten)) {
            Broken(std::to_string(nRequests) + " requests" + (blWritten ? " and a write" : "") + " about nothing",
                   {"TCP", 1});
        }
    }

    void Broken(const std::string& szPromise, const MappingKey& key) {
        if (mSzBroken.empty()) {
            const model::Router::Entry* pEntry = mRouter.At(key);
            mSzBroken = szPromise + ": " + key.first + " " + std::to_string(key.second) +
                        "\n    router: " + mRouter.habits.Text() + "\n    box " + mRouter.szBox +
                        (pEntry == nullptr
                             ? ", nothing there"
                             : ", there " + pEntry->mapping.szClient + ":" + std::to_string(pEntry->mapping.nBoxPort) +
                                   " '" + pEntry->mapping.szDescription + "'") +
                        "\n" + mPRecord->Text();
        }
    }

    // Nobody else's entry ever changes.
    void CheckStrangers(const std::map<MappingKey, model::Router::Entry>& mapBefore) {
        if (!mRouter.szBroken.empty()) {
            mSzBroken = mRouter.szBroken;
        }
        for (const auto& [key, before] : mapBefore) {
            const model::Router::Entry* pNow = mRouter.At(key);
            if (!before.blBox && !before.blOrphan &&
                (pNow == nullptr || pNow->blBox || pNow->mapping.nBoxPort != before.mapping.nBoxPort)) {
                Broken("a stranger's entry changed", key);
            }
        }
    }

    // What is said to be open is open; what may be left of ours is named.
    void CheckWords(const tavo::PassResult& result, bool blTrouble, const std::set<MappingKey>& setEnded) {
        for (size_t i = 0; i < mRgWanted.size(); ++i) {
            const MappingKey key = tavo::KeyOf(mRgWanted[i]);
            const model::Router::Entry* pEntry = mRouter.At(key);
            const bool blThere = pEntry != nullptr && pEntry->mapping.szClient == mRouter.szBox &&
                                 pEntry->mapping.nBoxPort == mRgWanted[i].nBoxPort;
            const tavo::Verdict& verdict = result.rgOutcomes.at(i).verdict;
            if (verdict.szWord.empty() || verdict.szWord == "written") {
                Broken("no verdict", key);
            }
            if (verdict.enState == tavo::PortState::kOpen && !blThere && !setEnded.contains(key)) {
                Broken("said to be open and is not", key);
            }
            if (!blTrouble && verdict.szWord == "lost" && blThere && !mRouter.habits.blSlowToShow) {
                Broken("said to be lost and is there", key);
            }
            if (mBlQuiet && !blTrouble && verdict.blAnew && mSetOpen.contains(key) && !mRouter.habits.blForgetsLease &&
                !mRouter.habits.blMute) {
                Broken("made anew where nothing had happened: closed until now", key);
            }
            if (verdict.enState == tavo::PortState::kOpen && pEntry != nullptr && pEntry->blBox) {
                mSetOpen.insert(key);
            } else {
                mSetOpen.erase(key);
            }
        }
        std::set<MappingKey> setNamed;
        std::set<MappingKey> setBoxPorts;
        for (const tavo::Outcome& outcome : result.rgOutcomes) {
            setNamed.emplace(outcome.szProtocol, outcome.nRouterPort);
            setBoxPorts.emplace(outcome.szProtocol, outcome.nBoxPort);
        }
        for (const auto& [key, entry] : mRouter.mMapTable) {
            // A blind one may have lent another port than was asked for, and the answer was lost: the box's port is
            // known.
            const bool blNamed = setNamed.contains(key) ||
                                 (mRouter.habits.blBlind && setBoxPorts.contains({key.first, entry.mapping.nBoxPort}));
            if (entry.blBox && mRouter.At(key) != nullptr && !blNamed) {
                Broken("ours, wanted by no rule, and not named", key);
            }
        }
    }

    // setLost: the places that this pass only looked at, and those whose lease ended meanwhile.
    void CheckPeace(const tavo::PassResult& result, const std::set<MappingKey>& setLost) {
        size_t nUsed = 0;
        for (const auto& [key, entry] : mRouter.mMapTable) {
            nUsed += mRouter.At(key) != nullptr ? 1 : 0;
        }
        for (size_t i = 0; i < mRgWanted.size(); ++i) {
            const MappingKey key = tavo::KeyOf(mRgWanted[i]);
            const model::Router::Entry* pEntry = mRouter.At(key);
            const bool blFree = pEntry == nullptr ? nUsed < mRouter.habits.nCapacity
                                                  : pEntry->blBox && (pEntry->mapping.szClient == mRouter.szBox ||
                                                                      !mRouter.habits.blSecure);
            // Elsewhere, or for the former address: what a blind one says at one asking is not asked for again at once.
            const auto made = mPRecord->Here().find(key);
            const bool blWaits =
                mRouter.habits.blBlind && (mHabit.mapElsewhere.contains(key) ||
                                           (made != mPRecord->Here().end() && made->second.szClient != mRouter.szBox));
            // A blind one lends one port for each of the box: to the first rule.
            const bool blShared =
                mRouter.habits.blBlind &&
                std::any_of(mRgWanted.begin(), mRgWanted.begin() + static_cast<std::ptrdiff_t>(i),
                            [&](const RouterMapping& earlier) {
                                return earlier.szProtocol == key.first && earlier.nBoxPort == mRgWanted[i].nBoxPort;
                            });
            // What it says that it took away is in the way.
            const bool blInTheWay =
                mRouter.habits.blKeepsRemoved && pEntry != nullptr &&
                (pEntry->mapping.szClient != mRouter.szBox || pEntry->mapping.nBoxPort != mRgWanted[i].nBoxPort);
            const bool blNotShownYet = mRouter.habits.blSlowToShow && pEntry != nullptr && pEntry->nMade >= mNPassAt;
            const bool blForgone = mBlDiskFull && result.rgOutcomes[i].verdict.szWord == tavo::kUnrecorded;
            if (blFree && !setLost.contains(key) && !blInTheWay && !blNotShownYet && !blWaits && !blShared &&
                !blForgone && result.rgOutcomes[i].verdict.enState != tavo::PortState::kOpen) {
                Broken("could be open and is not (" + result.rgOutcomes[i].verdict.szWord + ")", key);
            }
        }
        for (const auto& [key, entry] : mRouter.mMapTable) {
            const bool blOurs = entry.blBox && mRouter.At(key) != nullptr;
            const bool blWanted =
                std::any_of(mRgWanted.begin(), mRgWanted.end(),
                            [&key = key](const RouterMapping& wanted) { return tavo::KeyOf(wanted) == key; });
            if (blOurs && !blWanted && !mRouter.habits.blKeepsRemoved &&
                (!mRouter.habits.blSecure || entry.mapping.szClient == mRouter.szBox)) {
                Broken("outlives its rule", key);
            }
        }
    }

    std::mt19937 mRandom;
    int64_t mNNow = 1000000;
    model::Router mRouter;
    std::map<MappingKey, model::Router::Entry> mMapOther;
    int mNOtherLife = 1 << 20;             // of the other router
    std::map<std::string, int> mMapLives;  // of each router, as it was last heard
    bool mBlDoubtful = true;               // what a blind one granted may be gone
    bool mBlOther = false;
    std::vector<RouterMapping> mRgWanted;
    bool mBlHardware = true;                 // the routers can be told apart
    std::string mSzAddress = "192.168.1.1";  // of the one in front
    bool mBlDiskFull = false;
    bool mBlAllOpen = false;        // at the last pass whose cost was looked at
    int mNStopIn = 0;               // looks at the stop until there is one; 0: there is none
    int mNAdds = 0;                 // of this pass
    std::set<MappingKey> mSetOpen;  // at the last look
    std::string mSzDisk;
    std::optional<tavo::Record> mSaved;  // what its text is of
    std::unique_ptr<tavo::Record> mPRecord;
    tavo::Habits mHabit;
    tavo::Keeper mKeeper;
    std::string mSzLast;  // what the last pass had to say
    int mNBoots = 0;
    int64_t mNBootAt = 0;
    int64_t mNNext = 0;
    int64_t mNPassAt = 0;  // when the last one began
    int mNCheck = 120;
    int mNPeace = 0;        // passes since the last trouble
    bool mBlQuiet = false;  // nothing has happened since everything was as it is to be
    std::deque<std::string> mStory;
    std::string mSzBroken;
};

}  // namespace

int main(int argc, char** argv) {
    const unsigned nSeeds = argc > 1 ? static_cast<unsigned>(std::atoi(argv[1])) : 1000;
    const unsigned nFirst = argc > 2 ? static_cast<unsigned>(std::atoi(argv[2])) : 1;
    int nFailed = 0;
    int64_t nSeconds = 0;
    for (unsigned nSeed = nFirst; nSeed < nFirst + nSeeds && nFailed < 3; ++nSeed) {
        Life life(nSeed);
        const auto szBroken = life.Live();
        nSeconds += life.Seconds();
        if (szBroken) {
            ++nFailed;
            std::printf("seed %u: %s\n", nSeed, szBroken->c_str());
            for (const std::string& szEvent : life.Story()) {
                std::printf("    %s\n", szEvent.c_str());
            }
        }
    }
    std::printf("%u lives, %lld days: %s\n", nSeeds, static_cast<long long>(nSeconds / 86400),
                nFailed == 0 ? "every promise was kept" : "BROKEN PROMISES");
    return nFailed == 0 ? 0 : 1;
}
