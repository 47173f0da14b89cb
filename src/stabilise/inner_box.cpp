// The inner box: a large axis-aligned rectangle inside the area covered in every stabilised
// frame. The region is peeled layer by layer, columns against rows in the image's proportion;
// the last pixel to go is the box's centre, and the layers counted give its half-sizes.
#include <cstdlib>
#include <cstring>

#include "pellux/image.h"
#include "stabilise/stabilise_internal.hpp"

namespace {

constexpr const char *kName = "bComputeInnerBox";
constexpr std::size_t kListStep = 1000;

struct Pixel {
    int32_t x, y;
};

// Pixels queued for a later layer; entries before `head` have been peeled already.
class PixelList {
public:
    PixelList() = default;
    PixelList(const PixelList &) = delete;
    PixelList &operator=(const PixelList &) = delete;
    ~PixelList() { std::free(data_); }

    bool push(Pixel p)
    {
        if (size_ == capacity_ && !grow()) return false;
        data_[size_++] = p;
        return true;
    }
    std::size_t head() const { return head_; }
    std::size_t size() const { return size_; }
    Pixel operator[](std::size_t i) const { return data_[i]; }
    // Drops the entries before `end`; the storage is compacted once they fill half of it.
    void consume_to(std::size_t end)
    {
        head_ = end;
        if (head_ * 2 < capacity_) return;
        std::memmove(data_, data_ + head_, (size_ - head_) * sizeof(Pixel));
        size_ -= head_;
        head_ = 0;
    }
    bool reserve_first() { return grow(); }

private:
    bool grow()
    {
        const std::size_t bytes = (capacity_ + kListStep) * sizeof(Pixel);
        void *p = std::realloc(data_, bytes);
        if (p == nullptr) {
            PLX_ERR_START_AS(kName, PLX_ERROR_MALLOC_FAILED, "", static_cast<int64_t>(bytes));
            return false;
        }
        data_ = static_cast<Pixel *>(p);
        capacity_ += kListStep;
        return true;
    }
    Pixel *data_ = nullptr;
    std::size_t size_ = 0, capacity_ = 0, head_ = 0;
};

// Word-level access to a bit image: pixel c of a row is bit c mod 32 of word c / 32.
class Bits {
public:
    explicit Bits(const Plx_Image &image) : image_(image) {}
    const uint32_t *row(int32_t y) const { return static_cast<const uint32_t *>(plx_image_row(&image_, y)); }
    uint32_t *row(int32_t y) { return static_cast<uint32_t *>(plx_image_row(&image_, y)); }
    bool get(int32_t x, int32_t y) const { return (row(y)[x >> 5] >> (x & 31)) & 1u; }
    void set(int32_t x, int32_t y) { row(y)[x >> 5] |= 1u << (x & 31); }
    void clear(int32_t x, int32_t y) { row(y)[x >> 5] &= ~(1u << (x & 31)); }
    // Pixels x0 .. x1 - 1 of row y all set.
    bool run_set(int32_t y, int32_t x0, int32_t x1) const
    {
        const uint32_t *r = row(y);
        for (int32_t x = x0; x < x1;) {
            const int32_t bit = x & 31, n = std::min(32 - bit, x1 - x);
            const uint32_t want = (n == 32 ? ~0u : ((1u << n) - 1u)) << bit;
            if ((r[x >> 5] & want) != want) return false;
            x += n;
        }
        return true;
    }
    // Pixels y0 .. y1 - 1 of column x all set.
    bool column_set(int32_t x, int32_t y0, int32_t y1) const
    {
        for (int32_t y = y0; y < y1; ++y)
            if (!get(x, y)) return false;
        return true;
    }
    int32_t width() const { return image_.width; }
    int32_t height() const { return image_.height; }

private:
    Plx_Image image_;
};

struct ImageGuard {
    Plx_Image *image = nullptr;
    ~ImageGuard() { plx_image_free(image); }
};

struct Box {
    int32_t x, y, width, height;
};

// The peeling state: the eroded copy, the two edge lists with their queued-pixel markers.
struct Peeling {
    Bits work, queued_h, queued_v;
    PixelList h, v;
    uint64_t count = 0;

    // Queues p on list (once) when it is still set.
    bool queue(PixelList &list, Bits &queued, int32_t x, int32_t y)
    {
        if (!work.get(x, y) || queued.get(x, y)) return true;
        queued.set(x, y);
        return list.push({x, y});
    }

    bool scan(const Plx_Window &window)
    {
        const int32_t W = work.width(), H = work.height();
        for (int32_t y = window.y; y < window.y + window.height; ++y)
            for (int32_t x = window.x; x < window.x + window.width; ++x) {
                if (!work.get(x, y)) continue;
                ++count;
                if (x == 0 || x == W - 1 || !work.get(x - 1, y) || !work.get(x + 1, y))
                    if (!queue(h, queued_h, x, y)) return false;
                if (y == 0 || y == H - 1 || !work.get(x, y - 1) || !work.get(x, y + 1))
                    if (!queue(v, queued_v, x, y)) return false;
            }
        return true;
    }

    // Removes the still-set pixels of one layer of `along` (the horizontal list peels row
    // ends, the vertical one column ends). Neighbours in the peeling direction form the next
    // layer of the same list, the others join the other list. Sets `last` to the pixel whose
    // removal emptied the region.
    bool layer(bool horizontal, bool &emptied, Pixel &last)
    {
        PixelList &along = horizontal ? h : v, &across = horizontal ? v : h;
        Bits &queued_along = horizontal ? queued_h : queued_v, &queued_across = horizontal ? queued_v : queued_h;
        const int32_t W = work.width(), H = work.height();
        const std::size_t end = along.size();
        for (std::size_t i = along.head(); i < end; ++i) {
            const Pixel p = along[i];
            queued_along.clear(p.x, p.y);
            if (!work.get(p.x, p.y)) continue;
            work.clear(p.x, p.y);
            if (--count == 0) {
                emptied = true;
                last = p;
                return true;
            }
            const Pixel n[4] = {{p.x - 1, p.y}, {p.x + 1, p.y}, {p.x, p.y - 1}, {p.x, p.y + 1}};
            const bool has[4] = {p.x > 0, p.x + 1 < W, p.y > 0, p.y + 1 < H};
            for (int k = 0; k < 4; ++k) {
                if (!has[k]) continue;
                const bool same = (k < 2) == horizontal;
                if (!queue(same ? along : across, same ? queued_along : queued_across, n[k].x, n[k].y)) return false;
            }
        }
        along.consume_to(end);
        return true;
    }
};

}  // namespace

extern "C" {

PLANO_API Plx_Bool bComputeInnerBox(const Plx_Image *region, uint32_t box[4])
{
    if (!plano::stabilise::given(__func__, region, box)) return 0;
    if (region->type != PLX_TYPE_BIT) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "region is not a bit image", region->type);
        return 0;
    }
    Plx_Window window;
    if (!plx_image_get_active_subwindow_b(region, &window)) {
        PLX_ERR_PASS();
        return 0;
    }
    if (window.width == 0 || window.height == 0) {
        box[0] = box[1] = box[2] = box[3] = 0;
        return 1;
    }
    ImageGuard copies[3];
    for (ImageGuard &c : copies) {
        c.image = plx_image_copy_q(region, nullptr);
        if (c.image == nullptr) {
            PLX_ERR_PASS();
            return 0;
        }
    }
    if (!plx_image_fill_zero(copies[1].image) || !plx_image_fill_zero(copies[2].image)) {
        PLX_ERR_PASS();
        return 0;
    }
    Peeling peel{Bits(*copies[0].image), Bits(*copies[1].image), Bits(*copies[2].image), {}, {}, 0};
    if (!peel.h.reserve_first() || !peel.v.reserve_first() || !peel.scan(window)) return 0;

    // Rows against columns in the image's proportion: b * H <= a * W peels a row layer.
    const uint64_t W = static_cast<uint64_t>(region->width), H = static_cast<uint64_t>(region->height);
    uint64_t a = 0, b = 0;
    bool emptied = false;
    Pixel centre{window.x, window.y};
    while (!emptied) {
        const bool horizontal = b * H <= a * W;
        if (!peel.layer(horizontal, emptied, centre)) return 0;
        if (!emptied) ++(horizontal ? b : a);
    }

    const Bits covered(*region);
    // A complete layer keeps exactly the pixels whose two neighbours along it are set (the
    // region eroded by a 3-pixel segment), so the centre survived an erosion by this whole box:
    // every pixel of it is set, and it lies inside the image.
    const auto hb = static_cast<int32_t>(b), ha = static_cast<int32_t>(a);
    Box r{centre.x - hb, centre.y - ha, 2 * hb + 1, 2 * ha + 1};
    // Grow edge by edge while whole columns and rows of the region stay set.
    for (bool changed = true; changed;) {
        changed = false;
        if (r.x > 0 && covered.column_set(r.x - 1, r.y, r.y + r.height)) {
            --r.x;
            ++r.width;
            changed = true;
        }
        if (r.y + r.height < region->height && covered.run_set(r.y + r.height, r.x, r.x + r.width)) {
            ++r.height;
            changed = true;
        }
        if (r.x + r.width < region->width && covered.column_set(r.x + r.width, r.y, r.y + r.height)) {
            ++r.width;
            changed = true;
        }
        if (r.y > 0 && covered.run_set(r.y - 1, r.x, r.x + r.width)) {
            --r.y;
            ++r.height;
            changed = true;
        }
    }
    box[0] = static_cast<uint32_t>(r.x);
    box[1] = static_cast<uint32_t>(r.y);
    box[2] = static_cast<uint32_t>(r.width);
    box[3] = static_cast<uint32_t>(r.height);
    return 1;
}

}  // extern "C"
