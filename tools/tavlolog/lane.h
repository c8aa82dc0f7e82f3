// One log type of one section read as a stream of entries: its pieces in
// order (generations, or a held file's pieces between note lines) through one
// fixed window, a line cut between pieces joined again, each entry given its
// instant. While following, the lane notices growth and rotation of its file.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "tools/tavlolog/entry.h"
#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/run_folder.h"
#include "tools/tavlolog/zone.h"

namespace tavlolog {

// What every lane of a section shares.
struct LaneContext {
    std::string run_name, run_path;
    bool has_date = false;
    int64_t folder_days = 0;
    bool has_boot_wallclock = false;  // for this section's boot
    int64_t boot_wallclock_ns = 0;
    int boot = 0;
    std::string boot_name;
};

class Lane {
  public:
    // The window: the longest line read whole; longer ones are shown in pieces.
    static constexpr size_t kWindow = 256 * 1024;

    Lane(const LaneFiles& files, const LaneContext* context);
    ~Lane();
    Lane(const Lane&) = delete;
    Lane& operator=(const Lane&) = delete;

    // Reads the next entry: true with it in entry(), false when the lane has
    // nothing more (for now, while following).
    bool next();
    const Entry& entry() const { return reorders_ ? out_->entry : entry_; }
    // The lane's entries carry no comparable instant (Bluetooth bytes, kernel
    // lines without their boot's start): merged after the timed ones.
    bool untimed() const { return untimed_; }
    // The merge order: the instant, or that of the line before.
    int64_t key() const { return reorders_ ? out_->key : key_; }
    // From now on the run's file may grow: its end is not the end of the lane.
    void follow();
    // Following: picks up a rotation (the renamed file is read to its end
    // first, then the newer generations) or a file that appeared. true when a
    // piece was added.
    bool poll();

    // main_log holds two buffers whose lines the collector merges only in a short
    // window: a lane puts up to this many lines back in order of their instants.
    static constexpr size_t kReorderEntries = 4096;
    static constexpr size_t kReorderBytes = 4 * 1024 * 1024;

    // A held line's bookkeeping as counted against kReorderBytes.
    static constexpr size_t kHeldCost = 256;

    // A held line's place in the reordering window: by (key, arrival).
    struct Slot {
        int64_t key;
        uint64_t order;  // arrival << 16 | the held slot's number
    };

    // A line held for reordering, with its own copy of its texts.
    struct Held {
        Entry entry;
        int64_t key = 0;
        std::string text;  // tag, message and file name, one after the other
    };

  private:
    enum Read { GOT, NONE };
    bool read_one();
    Read next_line(std::string_view* line, uint64_t* offset, const std::string** file);
    bool append_piece(const Piece& piece);
    void make_entry(std::string_view line, uint64_t offset, const std::string& file);
    void android_entry(const ParsedLine& p);
    void kernel_entry(const ParsedLine& p);
    void bt_entry(std::string_view line, uint64_t offset);
    void inherit();
    void hold();
    void set_zone(std::string_view name);
    int year_of(int month, int day);

    Source source_;
    const LaneContext* context_;
    std::string base_path_;      // the followed file ("" for held pieces)
    std::vector<Piece> pieces_;
    std::vector<int> fds_;       // one per piece, -1 once read
    size_t piece_ = 0;           // the piece being read
    ino_t inode_ = 0;            // of the newest piece
    bool final_ = true;          // the end of the last piece is the end
    std::unique_ptr<char[]> buf_;
    size_t pos_ = 0, end_ = 0;   // unread bytes of the window
    uint64_t buf_offset_ = 0;    // file offset of buf_[0]
    // A line cut by a rotation or a note, waiting for its rest.
    std::string carry_, carry_file_, joined_;
    uint64_t carry_offset_ = 0;
    // A Bluetooth line of other bytes, shown in counted chunks.
    std::string_view hex_line_;
    uint64_t hex_offset_ = 0;
    size_t hex_done_ = 0;
    std::string hex_text_;

    std::unique_ptr<Zone> zone_;
    bool untimed_ = false;
    bool reorders_ = false;
    Entry entry_;
    int64_t key_ = INT64_MIN;
    // The reordering window: slots whose texts keep their room from line to
    // line, and the small records that name them: those that came in order in
    // a ring, the others in a heap; the next out is the earlier of their fronts.
    std::vector<Held> held_;
    std::vector<uint32_t> free_;
    std::vector<Slot> heap_;
    std::unique_ptr<Slot[]> ring_;
    size_t head_ = 0, count_ = 0;
    uint64_t arrivals_ = 0;
    size_t held_bytes_ = 0;
    uint32_t out_slot_ = UINT32_MAX;  // handed out: freed at the next call
    Held none_;
    const Held* out_ = &none_;
    bool has_last_ = false;
    int64_t last_instant_ = 0;
    int32_t last_offset_ = 0;
    int cached_md_ = -1, cached_year_ = 0;
    int cached_date_ = -1;
    int64_t cached_days_ = 0;
};

}  // namespace tavlolog
