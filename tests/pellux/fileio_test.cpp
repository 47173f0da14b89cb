// File helpers: exact little-endian bytes, bit-exact round trips, short files and failed
// writes, and the binary and text blocks of vectors and matrices.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

#include "failure_check.hpp"
#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

std::vector<unsigned char> bytes_of(FILE *f)
{
    std::fflush(f);
    long end = std::ftell(f);
    std::rewind(f);
    std::vector<unsigned char> out(static_cast<size_t>(end));
    EXPECT_EQ(std::fread(out.data(), 1, out.size(), f), out.size());
    std::rewind(f);
    return out;
}

std::string text_of(FILE *f)
{
    std::vector<unsigned char> b = bytes_of(f);
    return std::string(b.begin(), b.end());
}

// A file holding the given bytes, positioned at its start.
FILE *file_with(const std::vector<unsigned char> &bytes)
{
    FILE *f = std::tmpfile();
    EXPECT_NE(f, nullptr);
    if (!bytes.empty()) std::fwrite(bytes.data(), 1, bytes.size(), f);
    std::rewind(f);
    return f;
}

}  // namespace

TEST(FileIO, WritesExactLittleEndianBytes)
{
    FILE *f = std::tmpfile();
    ASSERT_NE(f, nullptr);
    const double d[2] = {1.0, -2.5};                 // 0x3FF0000000000000, 0xC004000000000000
    const int32_t i32[2] = {1, -2};
    const uint32_t u32[1] = {0x01020304u};
    const int16_t i16[2] = {-2, 0x1234};
    const uint16_t u16[1] = {0xABCDu};
    ASSERT_TRUE(plx_fwrite_lendian_f64(f, d, 2));
    ASSERT_TRUE(plx_fwrite_lendian_i32(f, i32, 2));
    ASSERT_TRUE(plx_fwrite_lendian_ui32(f, u32, 1));
    ASSERT_TRUE(plx_fwrite_lendian_i16(f, i16, 2));
    ASSERT_TRUE(plx_fwrite_lendian_ui16(f, u16, 1));
    ASSERT_TRUE(plx_fwrite_lendian_f64(f, d, 0));
    const std::vector<unsigned char> expected{
        0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0xF0, 0x3F,  // 1.0
        0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x04, 0xC0,  // -2.5
        0x01, 0x00, 0x00, 0x00, 0xFE, 0xFF, 0xFF, 0xFF,  // 1, -2
        0x04, 0x03, 0x02, 0x01,                          // 0x01020304
        0xFE, 0xFF, 0x34, 0x12,                          // -2, 0x1234
        0xCD, 0xAB};                                     // 0xABCD
    EXPECT_EQ(bytes_of(f), expected);

    double rd[2];
    int32_t ri[2];
    uint32_t ru;
    int16_t rs[2];
    uint16_t rus;
    ASSERT_TRUE(plx_fread_lendian_f64(f, rd, 2));
    ASSERT_TRUE(plx_fread_lendian_i32(f, ri, 2));
    ASSERT_TRUE(plx_fread_lendian_ui32(f, &ru, 1));
    ASSERT_TRUE(plx_fread_lendian_i16(f, rs, 2));
    ASSERT_TRUE(plx_fread_lendian_ui16(f, &rus, 1));
    EXPECT_EQ(rd[1], -2.5);
    EXPECT_EQ(ri[1], -2);
    EXPECT_EQ(ru, 0x01020304u);
    EXPECT_EQ(rs[0], -2);
    EXPECT_EQ(rus, 0xABCDu);
    std::fclose(f);
}

TEST(FileIO, LargeArraysRoundTripBitForBit)
{
    // More values than one internal chunk, with the awkward doubles included.
    std::vector<double> d(3001);
    for (size_t i = 0; i < d.size(); ++i) d[i] = std::ldexp(static_cast<double>(i) - 1500.5, static_cast<int>(i % 90) - 45);
    d[0] = -0.0;
    d[1] = std::numeric_limits<double>::infinity();
    d[2] = std::numeric_limits<double>::denorm_min();
    d[3] = std::nan("0x5");
    std::vector<int32_t> n(5000);
    for (size_t i = 0; i < n.size(); ++i) n[i] = static_cast<int32_t>(i * 2654435761u);

    FILE *f = std::tmpfile();
    ASSERT_NE(f, nullptr);
    ASSERT_TRUE(plx_fwrite_lendian_f64(f, d.data(), d.size()));
    ASSERT_TRUE(plx_fwrite_lendian_i32(f, n.data(), n.size()));
    EXPECT_EQ(bytes_of(f).size(), d.size() * 8 + n.size() * 4);
    std::vector<double> rd(d.size());
    std::vector<int32_t> rn(n.size());
    ASSERT_TRUE(plx_fread_lendian_f64(f, rd.data(), rd.size()));
    ASSERT_TRUE(plx_fread_lendian_i32(f, rn.data(), rn.size()));
    EXPECT_EQ(std::memcmp(rd.data(), d.data(), d.size() * sizeof(double)), 0);
    EXPECT_EQ(rn, n);
    std::fclose(f);
}

TEST(FileIO, ShortFilesFailedWritesAndNullArguments)
{
    // A short read fails with 26 and leaves the whole destination as it was, small or large.
    for (size_t count : {4u, 2000u}) {
        std::vector<unsigned char> bytes(4 * (count - 1), 0x11);
        FILE *f = file_with(bytes);
        std::vector<uint32_t> out(count, 7u);
        EXPECT_TRUE(fails_with(plx_fread_lendian_ui32(f, out.data(), count), PLX_ERROR_CORRUPTED_FILE));
        EXPECT_EQ(out, std::vector<uint32_t>(count, 7u));
        std::fclose(f);
    }
    FILE *empty = file_with({});
    uint16_t s = 9;
    EXPECT_TRUE(fails_with(plx_fread_lendian_ui16(empty, &s, 1), PLX_ERROR_CORRUPTED_FILE));
    EXPECT_EQ(s, 9);
    std::fclose(empty);

    // A stream open for reading only refuses writes.
    FILE *ro = std::fopen("/dev/null", "rb");
    ASSERT_NE(ro, nullptr);
    const double one = 1.0;
    EXPECT_TRUE(fails_with(plx_fwrite_lendian_f64(ro, &one, 1), PLX_ERROR_WRITING_FILE));
    std::fclose(ro);

    EXPECT_TRUE(fails_with(plx_fwrite_lendian_i16(nullptr, nullptr, 0), PLX_ERROR_ILLEGAL_ARGUMENT));
    FILE *f = std::tmpfile();
    EXPECT_TRUE(fails_with(plx_fread_lendian_f64(f, nullptr, 3), PLX_ERROR_ILLEGAL_ARGUMENT));
    std::fclose(f);
}

namespace {

Plx_SquMatrix square_of(Plx_SquMatrixType type, uint32_t n)
{
    Plx_SquMatrix A;
    EXPECT_NE(plx_squmat_form(&A, type, n), nullptr);
    EXPECT_TRUE(plx_squmat_fill_zero(&A));
    for (uint32_t r = 0; r < n; ++r)
        for (uint32_t c = 0; c < n; ++c) {
            bool stored = type == PLX_SQUMAT_GENERIC || (type == PLX_SQUMAT_SYMMETRIC && c <= r) ||
                          (type == PLX_SQUMAT_LOWER_TRIANGULAR && c <= r) ||
                          (type == PLX_SQUMAT_UPPER_TRIANGULAR && c >= r) || (type == PLX_SQUMAT_DIAGONAL && c == r);
            if (stored) {
                EXPECT_TRUE(plx_squmat_set(&A, r, c, 1.0 / (1 + r + 2 * c) - 0.25 * r));
            }
        }
    if (type == PLX_SQUMAT_SCALED_IDENTITY) {
        EXPECT_TRUE(plx_squmat_set(&A, 0, 0, -1.0 / 3));
    }
    return A;
}

void expect_same(const Plx_SquMatrix &A, const Plx_SquMatrix &B, double tol)
{
    ASSERT_EQ(A.type, B.type);
    ASSERT_EQ(A.size, B.size);
    for (uint32_t r = 0; r < A.size; ++r)
        for (uint32_t c = 0; c < A.size; ++c)
            EXPECT_NEAR(plx_squmat_get(&A, r, c), plx_squmat_get(&B, r, c), tol) << A.type << " " << r << "," << c;
}

const Plx_SquMatrixType kSquareTypes[] = {PLX_SQUMAT_SYMMETRIC,        PLX_SQUMAT_DIAGONAL,
                                          PLX_SQUMAT_SCALED_IDENTITY,  PLX_SQUMAT_LOWER_TRIANGULAR,
                                          PLX_SQUMAT_UPPER_TRIANGULAR, PLX_SQUMAT_GENERIC};

}  // namespace

TEST(FileIO, BinaryBlocksRoundTripWithTheirMagicNumbers)
{
    Plx_Vector x;
    ASSERT_NE(plx_vec_form(&x, 3), nullptr);
    x.data[0] = 0.1;
    x.data[1] = -2;
    x.data[2] = 1e300;
    Plx_Matrix M;
    ASSERT_NE(plx_mat_form(&M, 2, 3), nullptr);
    for (int i = 0; i < 6; ++i) M.data[i] = 1.0 / (i + 1);

    FILE *f = std::tmpfile();
    ASSERT_TRUE(plx_vec_fwrite(f, &x, 0xF3649123u));
    // The vector block: magic, rows, then the values.
    std::vector<unsigned char> b = bytes_of(f);
    ASSERT_EQ(b.size(), 4u + 4u + 24u);
    EXPECT_EQ(b[0], 0x23);
    EXPECT_EQ(b[3], 0xF3);
    EXPECT_EQ(b[4], 3);
    std::fseek(f, 0, SEEK_END);
    ASSERT_TRUE(plx_mat_fwrite(f, &M, 0x168EFC80u));
    for (Plx_SquMatrixType t : kSquareTypes) {
        Plx_SquMatrix A = square_of(t, 4);
        ASSERT_TRUE(plx_squmat_fwrite(f, &A, 0x428DE781u)) << t;
        plx_squmat_free(&A);
    }
    // Symmetric and triangular matrices keep one triangle: 10 values for n = 4.
    long sizes = 32 + (4 + 8 + 48);
    sizes += 6 * 12 + 8 * (10 + 4 + 1 + 10 + 10 + 16);
    EXPECT_EQ(static_cast<long>(bytes_of(f).size()), sizes);

    Plx_Vector rx;
    ASSERT_EQ(plx_vec_fread(f, &rx, 0xF3649123u), &rx);
    ASSERT_EQ(rx.rows, 3u);
    EXPECT_EQ(std::memcmp(rx.data, x.data, 3 * sizeof(double)), 0);
    Plx_Matrix *rM = plx_mat_fread(f, nullptr, 0x168EFC80u);
    ASSERT_NE(rM, nullptr);
    ASSERT_EQ(rM->rows, 2u);
    ASSERT_EQ(rM->cols, 3u);
    EXPECT_EQ(std::memcmp(rM->data, M.data, 6 * sizeof(double)), 0);
    for (Plx_SquMatrixType t : kSquareTypes) {
        Plx_SquMatrix A = square_of(t, 4), R;
        ASSERT_EQ(plx_squmat_fread(f, &R, 0x428DE781u), &R) << t;
        expect_same(A, R, 0.0);
        plx_squmat_free(&A);
        plx_squmat_free(&R);
    }
    plx_mat_free(rM);
    plx_vec_free(&rx);

    // Another block's magic number, or a block cut short, is a malformed file; the caller's
    // storage keeps its bytes.
    std::rewind(f);
    Plx_Vector untouched;
    std::memset(&untouched, 0xAB, sizeof untouched);
    Plx_Vector copy = untouched;
    EXPECT_TRUE(fails_with(plx_vec_fread(f, &untouched, 0x57CA10B3u), PLX_ERROR_CORRUPTED_FILE));
    EXPECT_EQ(std::memcmp(&untouched, &copy, sizeof copy), 0);
    std::fclose(f);

    f = std::tmpfile();
    ASSERT_TRUE(plx_mat_fwrite(f, &M, 1u));
    std::vector<unsigned char> cut = bytes_of(f);
    cut.resize(cut.size() - 1);
    std::fclose(f);
    f = file_with(cut);
    EXPECT_TRUE(fails_with(plx_mat_fread(f, nullptr, 1u), PLX_ERROR_CORRUPTED_FILE));
    std::fclose(f);

    // A stored square-matrix type outside the known ones is a malformed file.
    for (uint8_t stored : {uint8_t{0}, uint8_t{7}, uint8_t{99}}) {
        Plx_SquMatrix A = square_of(PLX_SQUMAT_SYMMETRIC, 2);
        f = std::tmpfile();
        ASSERT_TRUE(plx_squmat_fwrite(f, &A, 1u));
        std::vector<unsigned char> block = bytes_of(f);
        std::fclose(f);
        block[4] = stored;
        f = file_with(block);
        EXPECT_TRUE(fails_with(plx_squmat_fread(f, nullptr, 1u), PLX_ERROR_CORRUPTED_FILE)) << int(stored);
        std::fclose(f);
        plx_squmat_free(&A);
    }

    Plx_SquMatrix bad{};
    bad.type = PLX_SQUMAT_NONE;
    f = std::tmpfile();
    EXPECT_TRUE(fails_with(plx_squmat_fwrite(f, &bad, 1u), PLX_ERROR_ILLEGAL_TYPE));
    std::fclose(f);
    plx_mat_free(&M);
    plx_vec_free(&x);
}

TEST(FileIO, TextBlocksPrintReadablyAndScanBack)
{
    Plx_Vector x;
    ASSERT_NE(plx_vec_form(&x, 3), nullptr);
    x.data[0] = 1;
    x.data[1] = 2.5;
    x.data[2] = -0.1;
    FILE *f = std::tmpfile();
    ASSERT_TRUE(plx_vec_fprint(f, &x, "x", 1));
    EXPECT_EQ(text_of(f), " x (vector 3):\n   1 2.5 -0.1\n");
    std::fseek(f, 0, SEEK_END);

    Plx_Matrix M;
    ASSERT_NE(plx_mat_form(&M, 2, 2), nullptr);
    M.data[0] = 1.0 / 3;
    M.data[1] = -7;
    M.data[2] = 1e-200;
    M.data[3] = 123456789.125;
    ASSERT_TRUE(plx_mat_fprint(f, &M, "B0", 0));
    for (Plx_SquMatrixType t : kSquareTypes) {
        Plx_SquMatrix A = square_of(t, 3);
        ASSERT_TRUE(plx_squmat_fprint(f, &A, "A0", 2)) << t;
        plx_squmat_free(&A);
    }

    std::rewind(f);
    Plx_Vector *rx = plx_vec_fscanf(f, nullptr, "x");
    ASSERT_NE(rx, nullptr);
    ASSERT_EQ(rx->rows, 3u);
    EXPECT_EQ(rx->data[1], 2.5);
    EXPECT_EQ(rx->data[2], -0.1);
    Plx_Matrix rM;
    ASSERT_EQ(plx_mat_fscanf(f, &rM, nullptr), &rM);  // any name
    ASSERT_EQ(rM.rows, 2u);
    for (int i = 0; i < 4; ++i) EXPECT_NEAR(rM.data[i], M.data[i], 1e-14 * std::fabs(M.data[i]));
    for (Plx_SquMatrixType t : kSquareTypes) {
        Plx_SquMatrix A = square_of(t, 3), R;
        ASSERT_EQ(plx_squmat_fscanf(f, &R, "A0"), &R) << t;
        expect_same(A, R, 1e-14);
        plx_squmat_free(&A);
        plx_squmat_free(&R);
    }
    plx_mat_free(&rM);
    plx_vec_free(rx);

    // A different name, a different kind of block, or a missing value is malformed.
    std::rewind(f);
    EXPECT_TRUE(fails_with(plx_vec_fscanf(f, nullptr, "b"), PLX_ERROR_CORRUPTED_FILE));
    std::rewind(f);
    EXPECT_TRUE(fails_with(plx_mat_fscanf(f, nullptr, "x"), PLX_ERROR_CORRUPTED_FILE));
    std::fclose(f);
    const char cut[] = "x (vector 3):\n  1 2\n";
    f = file_with(std::vector<unsigned char>(cut, cut + sizeof cut - 1));
    EXPECT_TRUE(fails_with(plx_vec_fscanf(f, nullptr, "x"), PLX_ERROR_CORRUPTED_FILE));
    std::fclose(f);

    f = std::tmpfile();
    EXPECT_TRUE(fails_with(plx_vec_fprint(f, &x, "two words", 0), PLX_ERROR_ILLEGAL_ARGUMENT));
    std::fclose(f);
    plx_mat_free(&M);
    plx_vec_free(&x);
}
