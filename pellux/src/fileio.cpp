// Little-endian numbers, and binary and text blocks of vectors and matrices.
#include "pellux/fileio.h"

#include <bit>
#include <cstdint>
#include <cstdio>
#include <cctype>
#include <cstring>

#include "pellux/detail/util.hpp"
#include "pellux/error.h"

// A callee failed: a code-1 record under the exported function's name.
#define PLX_ERR_PASS_AS(function) \
    plx_err_register_fileline((function), PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0)

namespace {

template <class T> struct BitsOf;
template <> struct BitsOf<double> { using type = uint64_t; };
template <> struct BitsOf<int32_t> { using type = uint32_t; };
template <> struct BitsOf<uint32_t> { using type = uint32_t; };
template <> struct BitsOf<int16_t> { using type = uint16_t; };
template <> struct BitsOf<uint16_t> { using type = uint16_t; };

// Values go through a byte buffer in chunks: the bytes are composed with shifts, so the host's
// own byte order never shows in the file.
constexpr size_t kChunkBytes = 4096;

template <class T>
bool write_lendian(FILE *file, const T *values, size_t count, const char *function)
{
    static_assert(sizeof(T) == sizeof(typename BitsOf<T>::type));
    if (file == nullptr || (values == nullptr && count != 0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT,
                         file == nullptr ? "null file" : "null array", 0);
        return false;
    }
    using Bits = typename BitsOf<T>::type;
    constexpr size_t per_chunk = kChunkBytes / sizeof(T);
    unsigned char buffer[kChunkBytes];
    for (size_t done = 0; done < count;) {
        size_t n = count - done < per_chunk ? count - done : per_chunk;
        for (size_t i = 0; i < n; ++i) {
            Bits bits = std::bit_cast<Bits>(values[done + i]);
            for (size_t b = 0; b < sizeof(T); ++b)
                buffer[i * sizeof(T) + b] = static_cast<unsigned char>(bits >> (8 * b));
        }
        if (std::fwrite(buffer, sizeof(T), n, file) != n) {
            PLX_ERR_START_AS(function, PLX_ERROR_WRITING_FILE, "short write",
                             static_cast<int64_t>(done));
            return false;
        }
        done += n;
    }
    return true;
}

// The whole array is read before any value is stored, so a short file leaves the caller's
// array as it was (a heap buffer is used when the array is larger than one chunk).
template <class T>
bool read_lendian(FILE *file, T *values, size_t count, const char *function)
{
    if (file == nullptr || (values == nullptr && count != 0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT,
                         file == nullptr ? "null file" : "null array", 0);
        return false;
    }
    using Bits = typename BitsOf<T>::type;
    unsigned char local[kChunkBytes];
    plx::HeapPtr<unsigned char> heap;
    unsigned char *buffer = local;
    if (count > kChunkBytes / sizeof(T)) {
        if (count > SIZE_MAX / sizeof(T)) {
            PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "count out of range", -1);
            return false;
        }
        heap.reset(plx::heap_alloc<unsigned char>(count * sizeof(T), function, __FILE__, __LINE__));
        if (heap == nullptr) return false;
        buffer = heap.get();
    }
    size_t got = std::fread(buffer, sizeof(T), count, file);
    if (got != count) {
        PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, "file ends early", static_cast<int64_t>(got));
        return false;
    }
    for (size_t i = 0; i < count; ++i) {
        Bits bits = 0;
        for (size_t b = 0; b < sizeof(T); ++b)
            bits |= static_cast<Bits>(static_cast<Bits>(buffer[i * sizeof(T) + b]) << (8 * b));
        values[i] = std::bit_cast<T>(bits);
    }
    return true;
}


// ---- vector and matrix blocks ----

// Values stored per row of a square matrix in the binary form: the first one and how many.
struct RowSpan {
    uint32_t first, count;
};

RowSpan binary_row(Plx_SquMatrixType type, uint32_t n, uint32_t r)
{
    switch (type) {
    case PLX_SQUMAT_SYMMETRIC:
    case PLX_SQUMAT_LOWER_TRIANGULAR: return {0, r + 1};
    case PLX_SQUMAT_UPPER_TRIANGULAR: return {r, n - r};
    default: return {0, n};
    }
}

bool full_storage(Plx_SquMatrixType type)
{
    return type == PLX_SQUMAT_SYMMETRIC || type == PLX_SQUMAT_LOWER_TRIANGULAR ||
           type == PLX_SQUMAT_UPPER_TRIANGULAR || type == PLX_SQUMAT_GENERIC;
}

// Takes the stored number, not the enum: a number outside the enum's values must be refused
// before it is ever held in one.
bool known_squmat(uint32_t code)
{
    return code >= PLX_SQUMAT_SYMMETRIC && code <= PLX_SQUMAT_GENERIC;
}

// Restores what the structure implies after reading only part of a full array: the mirrored
// upper triangle of a symmetric matrix, the zeros of a triangular one.
void complete_square(Plx_SquMatrix *A)
{
    uint32_t n = A->size;
    double *d = A->data;
    for (uint32_t r = 0; r < n; ++r)
        for (uint32_t c = r + 1; c < n; ++c) {
            size_t upper = size_t(r) * n + c, lower = size_t(c) * n + r;
            if (A->type == PLX_SQUMAT_SYMMETRIC) d[upper] = d[lower];
            else if (A->type == PLX_SQUMAT_LOWER_TRIANGULAR) d[upper] = 0.0;
            else if (A->type == PLX_SQUMAT_UPPER_TRIANGULAR) d[lower] = 0.0;
        }
}

const char *squmat_word(Plx_SquMatrixType type)
{
    switch (type) {
    case PLX_SQUMAT_SYMMETRIC: return "symmetric";
    case PLX_SQUMAT_DIAGONAL: return "diagonal";
    case PLX_SQUMAT_SCALED_IDENTITY: return "scaled-identity";
    case PLX_SQUMAT_LOWER_TRIANGULAR: return "lower-triangular";
    case PLX_SQUMAT_UPPER_TRIANGULAR: return "upper-triangular";
    case PLX_SQUMAT_GENERIC: return "generic";
    default: return nullptr;
    }
}

bool squmat_from_word(const char *word, Plx_SquMatrixType *type)
{
    for (int t = PLX_SQUMAT_SYMMETRIC; t <= PLX_SQUMAT_GENERIC; ++t) {
        const char *w = squmat_word(static_cast<Plx_SquMatrixType>(t));
        if (w != nullptr && std::strcmp(w, word) == 0) {
            *type = static_cast<Plx_SquMatrixType>(t);
            return true;
        }
    }
    return false;
}

// Rows of the text form of a square matrix: each row's values as held in the full array, a
// diagonal on one line, a scaled identity as its one value.
uint32_t text_rows(Plx_SquMatrixType type, uint32_t n)
{
    if (full_storage(type)) return n;
    return n > 0 ? 1 : 0;
}

uint32_t text_row_length(Plx_SquMatrixType type, uint32_t n) { return type == PLX_SQUMAT_SCALED_IDENTITY ? 1 : n; }

bool check_file(FILE *file, const void *record, const char *function)
{
    if (file == nullptr || record == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, file == nullptr ? "null file" : "null record", 0);
        return false;
    }
    return true;
}

bool write_heading(FILE *file, uint32_t magic, const uint32_t *sizes, size_t count, const char *function)
{
    if (!plx_fwrite_lendian_ui32(file, &magic, 1) || !plx_fwrite_lendian_ui32(file, sizes, count)) {
        PLX_ERR_PASS_AS(function);
        return false;
    }
    return true;
}

// Reads the magic number (which must match) and count sizes.
bool read_heading(FILE *file, uint32_t magic, uint32_t *sizes, size_t count, const char *function)
{
    uint32_t found = 0;
    if (!plx_fread_lendian_ui32(file, &found, 1)) {
        PLX_ERR_PASS_AS(function);
        return false;
    }
    if (found != magic) {
        PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, "unexpected block", found);
        return false;
    }
    if (!plx_fread_lendian_ui32(file, sizes, count)) {
        PLX_ERR_PASS_AS(function);
        return false;
    }
    return true;
}

bool valid_name(const char *name)
{
    if (name == nullptr || name[0] == '\0') return false;
    for (const char *c = name; *c != '\0'; ++c)
        if (std::isspace(static_cast<unsigned char>(*c))) return false;
    return true;
}

bool print_heading(FILE *file, const char *name, uint32_t indent, const char *kind, const uint32_t *sizes,
                   size_t count, const char *function)
{
    if (!valid_name(name)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "name empty or with white space", 0);
        return false;
    }
    bool ok = std::fprintf(file, "%*s%s (%s", static_cast<int>(indent), "", name, kind) >= 0;
    for (size_t i = 0; i < count && ok; ++i) ok = std::fprintf(file, " %u", sizes[i]) >= 0;
    ok = ok && std::fputs("):\n", file) >= 0;
    if (!ok) PLX_ERR_START_AS(function, PLX_ERROR_WRITING_FILE, "", 0);
    return ok;
}

bool print_row(FILE *file, uint32_t indent, const double *values, size_t count, const char *function)
{
    bool ok = std::fprintf(file, "%*s", static_cast<int>(indent + 2), "") >= 0;
    for (size_t i = 0; i < count && ok; ++i) ok = std::fprintf(file, i == 0 ? "%1.15g" : " %1.15g", values[i]) >= 0;
    ok = ok && std::fputc('\n', file) != EOF;
    if (!ok) PLX_ERR_START_AS(function, PLX_ERROR_WRITING_FILE, "", 0);
    return ok;
}

// Reads "<name> (<kind> <sizes...>):" where kind is given, or returned in kind_out.
bool scan_heading(FILE *file, const char *name, const char *kind, char *kind_out, uint32_t *sizes, size_t count,
                  const char *function)
{
    char word[256];
    if (std::fscanf(file, " %255s", word) != 1 || (name != nullptr && std::strcmp(word, name) != 0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, name != nullptr ? name : "missing name", 0);
        return false;
    }
    char found[32];
    if (std::fscanf(file, " (%31[^ \t\n)]", found) != 1 || (kind != nullptr && std::strcmp(found, kind) != 0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, "unexpected kind of block", 0);
        return false;
    }
    if (kind_out != nullptr) std::strcpy(kind_out, found);
    for (size_t i = 0; i < count; ++i) {
        long long v = -1;
        if (std::fscanf(file, "%lld", &v) != 1 || v < 0 || v > static_cast<long long>(UINT32_MAX)) {
            PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, "bad size", static_cast<int64_t>(v));
            return false;
        }
        sizes[i] = static_cast<uint32_t>(v);
    }
    int end = -1;
    std::fscanf(file, " ):%n", &end);  // %n is only reached when both characters matched
    if (end < 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, "heading not closed", 0);
        return false;
    }
    return true;
}

bool scan_values(FILE *file, double *values, size_t count, const char *function)
{
    for (size_t i = 0; i < count; ++i)
        if (std::fscanf(file, "%lf", &values[i]) != 1) {
            PLX_ERR_START_AS(function, PLX_ERROR_CORRUPTED_FILE, "missing value", static_cast<int64_t>(i));
            return false;
        }
    return true;
}

// Readers build the record aside and copy it into the caller's storage only once it is
// complete; without storage the record itself comes from the heap.
template <class Rec, class Former, class Filler, class Freer>
Rec *read_record(Rec *dest, Former form, Filler fill, Freer release)
{
    Rec local;
    Rec *rec = form(dest == nullptr ? nullptr : &local);
    if (rec == nullptr) return nullptr;
    if (!fill(rec)) {
        release(rec);
        return nullptr;
    }
    if (dest == nullptr) return rec;
    *dest = local;
    return dest;
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_fwrite_lendian_f64(FILE *file, const double *values, size_t count)
{
    return write_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fwrite_lendian_i32(FILE *file, const int32_t *values, size_t count)
{
    return write_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fwrite_lendian_ui32(FILE *file, const uint32_t *values, size_t count)
{
    return write_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fwrite_lendian_i16(FILE *file, const int16_t *values, size_t count)
{
    return write_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fwrite_lendian_ui16(FILE *file, const uint16_t *values, size_t count)
{
    return write_lendian(file, values, count, __func__);
}

PLX_API Plx_Bool plx_fread_lendian_f64(FILE *file, double *values, size_t count)
{
    return read_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fread_lendian_i32(FILE *file, int32_t *values, size_t count)
{
    return read_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fread_lendian_ui32(FILE *file, uint32_t *values, size_t count)
{
    return read_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fread_lendian_i16(FILE *file, int16_t *values, size_t count)
{
    return read_lendian(file, values, count, __func__);
}
PLX_API Plx_Bool plx_fread_lendian_ui16(FILE *file, uint16_t *values, size_t count)
{
    return read_lendian(file, values, count, __func__);
}

PLX_API Plx_Bool plx_mat_fwrite(FILE *file, const Plx_Matrix *A, uint32_t magic)
{
    if (!check_file(file, A, __func__)) return PLX_FALSE;
    const uint32_t sizes[2] = {A->rows, A->cols};
    if (!write_heading(file, magic, sizes, 2, __func__)) return PLX_FALSE;
    if (!plx_fwrite_lendian_f64(file, A->data, size_t(A->rows) * A->cols)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_fwrite(FILE *file, const Plx_Vector *x, uint32_t magic)
{
    if (!check_file(file, x, __func__)) return PLX_FALSE;
    if (!write_heading(file, magic, &x->rows, 1, __func__)) return PLX_FALSE;
    if (!plx_fwrite_lendian_f64(file, x->data, x->rows)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_fwrite(FILE *file, const Plx_SquMatrix *A, uint32_t magic)
{
    if (!check_file(file, A, __func__)) return PLX_FALSE;
    if (!known_squmat(static_cast<uint32_t>(A->type))) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown square matrix type", A->type);
        return PLX_FALSE;
    }
    const uint32_t sizes[2] = {static_cast<uint32_t>(A->type), A->size};
    if (!write_heading(file, magic, sizes, 2, __func__)) return PLX_FALSE;
    uint32_t n = A->size;
    bool ok = true;
    if (A->type == PLX_SQUMAT_DIAGONAL) ok = plx_fwrite_lendian_f64(file, A->data, n);
    else if (A->type == PLX_SQUMAT_SCALED_IDENTITY) ok = plx_fwrite_lendian_f64(file, A->data, 1);
    else
        for (uint32_t r = 0; r < n && ok; ++r) {
            RowSpan span = binary_row(A->type, n, r);
            ok = plx_fwrite_lendian_f64(file, A->data + size_t(r) * n + span.first, span.count);
        }
    if (!ok) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLX_API Plx_Matrix *plx_mat_fread(FILE *file, Plx_Matrix *A, uint32_t magic)
{
    if (!check_file(file, file, __func__)) return nullptr;
    uint32_t sizes[2];
    if (!read_heading(file, magic, sizes, 2, __func__)) return nullptr;
    Plx_Matrix *rec = read_record(
        A, [&](Plx_Matrix *m) { return plx_mat_form(m, sizes[0], sizes[1]); },
        [&](Plx_Matrix *m) { return plx_fread_lendian_f64(file, m->data, size_t(sizes[0]) * sizes[1]) != 0; },
        plx_mat_free);
    if (rec == nullptr) PLX_ERR_PASS();
    return rec;
}

PLX_API Plx_Vector *plx_vec_fread(FILE *file, Plx_Vector *x, uint32_t magic)
{
    if (!check_file(file, file, __func__)) return nullptr;
    uint32_t rows;
    if (!read_heading(file, magic, &rows, 1, __func__)) return nullptr;
    Plx_Vector *rec = read_record(
        x, [&](Plx_Vector *v) { return plx_vec_form(v, rows); },
        [&](Plx_Vector *v) { return plx_fread_lendian_f64(file, v->data, rows) != 0; }, plx_vec_free);
    if (rec == nullptr) PLX_ERR_PASS();
    return rec;
}

PLX_API Plx_SquMatrix *plx_squmat_fread(FILE *file, Plx_SquMatrix *A, uint32_t magic)
{
    if (!check_file(file, file, __func__)) return nullptr;
    uint32_t sizes[2];
    if (!read_heading(file, magic, sizes, 2, __func__)) return nullptr;
    if (!known_squmat(sizes[0])) {
        PLX_ERR_START(PLX_ERROR_CORRUPTED_FILE, "unknown square matrix type", sizes[0]);
        return nullptr;
    }
    auto type = static_cast<Plx_SquMatrixType>(sizes[0]);
    uint32_t n = sizes[1];
    Plx_SquMatrix *rec = read_record(
        A, [&](Plx_SquMatrix *m) { return plx_squmat_form(m, type, n); },
        [&](Plx_SquMatrix *m) {
            if (type == PLX_SQUMAT_DIAGONAL) return plx_fread_lendian_f64(file, m->data, n) != 0;
            if (type == PLX_SQUMAT_SCALED_IDENTITY) return plx_fread_lendian_f64(file, m->data, 1) != 0;
            for (uint32_t r = 0; r < n; ++r) {
                RowSpan span = binary_row(type, n, r);
                if (!plx_fread_lendian_f64(file, m->data + size_t(r) * n + span.first, span.count)) return false;
            }
            complete_square(m);
            return true;
        },
        plx_squmat_free);
    if (rec == nullptr) PLX_ERR_PASS();
    return rec;
}

PLX_API Plx_Bool plx_mat_fprint(FILE *file, const Plx_Matrix *A, const char *name, uint32_t indent)
{
    if (!check_file(file, A, __func__)) return PLX_FALSE;
    const uint32_t sizes[2] = {A->rows, A->cols};
    if (!print_heading(file, name, indent, "matrix", sizes, 2, __func__)) return PLX_FALSE;
    if (A->cols > 0)
        for (uint32_t r = 0; r < A->rows; ++r)
            if (!print_row(file, indent, A->data + size_t(r) * A->cols, A->cols, __func__)) return PLX_FALSE;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_fprint(FILE *file, const Plx_Vector *x, const char *name, uint32_t indent)
{
    if (!check_file(file, x, __func__)) return PLX_FALSE;
    if (!print_heading(file, name, indent, "vector", &x->rows, 1, __func__)) return PLX_FALSE;
    if (x->rows > 0 && !print_row(file, indent, x->data, x->rows, __func__)) return PLX_FALSE;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_fprint(FILE *file, const Plx_SquMatrix *A, const char *name, uint32_t indent)
{
    if (!check_file(file, A, __func__)) return PLX_FALSE;
    const char *word = squmat_word(A->type);
    if (word == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown square matrix type", A->type);
        return PLX_FALSE;
    }
    if (!print_heading(file, name, indent, word, &A->size, 1, __func__)) return PLX_FALSE;
    uint32_t rows = text_rows(A->type, A->size), length = text_row_length(A->type, A->size);
    for (uint32_t r = 0; r < rows; ++r)
        if (!print_row(file, indent, A->data + size_t(r) * length, length, __func__)) return PLX_FALSE;
    return PLX_TRUE;
}

PLX_API Plx_Matrix *plx_mat_fscanf(FILE *file, Plx_Matrix *A, const char *name)
{
    const char *function = __func__;
    if (!check_file(file, file, __func__)) return nullptr;
    uint32_t sizes[2];
    if (!scan_heading(file, name, "matrix", nullptr, sizes, 2, __func__)) return nullptr;
    Plx_Matrix *rec = read_record(
        A, [&](Plx_Matrix *m) { return plx_mat_form(m, sizes[0], sizes[1]); },
        [&](Plx_Matrix *m) { return scan_values(file, m->data, size_t(sizes[0]) * sizes[1], function); },
        plx_mat_free);
    if (rec == nullptr) PLX_ERR_PASS();
    return rec;
}

PLX_API Plx_Vector *plx_vec_fscanf(FILE *file, Plx_Vector *x, const char *name)
{
    const char *function = __func__;
    if (!check_file(file, file, __func__)) return nullptr;
    uint32_t rows;
    if (!scan_heading(file, name, "vector", nullptr, &rows, 1, __func__)) return nullptr;
    Plx_Vector *rec = read_record(
        x, [&](Plx_Vector *v) { return plx_vec_form(v, rows); },
        [&](Plx_Vector *v) { return scan_values(file, v->data, rows, function); }, plx_vec_free);
    if (rec == nullptr) PLX_ERR_PASS();
    return rec;
}

PLX_API Plx_SquMatrix *plx_squmat_fscanf(FILE *file, Plx_SquMatrix *A, const char *name)
{
    const char *function = __func__;
    if (!check_file(file, file, __func__)) return nullptr;
    char word[32];
    uint32_t n;
    if (!scan_heading(file, name, nullptr, word, &n, 1, __func__)) return nullptr;
    Plx_SquMatrixType type;
    if (!squmat_from_word(word, &type)) {
        PLX_ERR_START(PLX_ERROR_CORRUPTED_FILE, "unknown square matrix type", 0);
        return nullptr;
    }
    Plx_SquMatrix *rec = read_record(
        A, [&](Plx_SquMatrix *m) { return plx_squmat_form(m, type, n); },
        [&](Plx_SquMatrix *m) {
            size_t count = size_t(text_rows(type, n)) * text_row_length(type, n);
            if (!scan_values(file, m->data, count, function)) return false;
            if (full_storage(type)) complete_square(m);
            return true;
        },
        plx_squmat_free);
    if (rec == nullptr) PLX_ERR_PASS();
    return rec;
}

}  // extern "C"
