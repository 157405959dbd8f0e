// Chunk reading and writing, file identity, and the cleaning of relative
// paths.
#include "dpx/dpx.h"

#include "cxfile.h"
#include "trc/trc1.h"

TRC1_DEFINE_UNIT("dpxxfer");

namespace {

bool is_separator(char c)
{
    return c == '/' || c == '\\';
}

// True when `p` starts a segment that is exactly `dots` followed by a
// separator or the end.
bool is_dot_segment(const char *p, int dots)
{
    for (int i = 0; i < dots; ++i) {
        if (p[i] != '.')
            return false;
    }
    return p[dots] == '\0' || is_separator(p[dots]);
}

}  // namespace

extern "C" {

dpx_status dpx_cleanup_rel_path(const char *rel, char *clean)
{
    TRC1_FUNCTION();
    if (rel == nullptr || clean == nullptr)
        return DPX_E_INVALID_PARAM;
    size_t out = 0;  // length of the text built so far
    const char *p = rel;
    while (*p != '\0') {
        if (is_separator(*p)) {
            if (out > 0)
                clean[out++] = '/';
            while (is_separator(*p))
                ++p;
        } else if (is_dot_segment(p, 1)) {
            ++p;
            if (is_separator(*p))
                ++p;
        } else if (is_dot_segment(p, 2)) {
            // Drop the last segment with the separator behind it; at the start
            // there is nothing above to climb to.
            if (out > 0) {
                size_t cut = out - 1;  // the '/' that ends the text
                while (cut > 0 && clean[cut - 1] != '/')
                    --cut;
                out = cut;
            }
            p += 2;
            while (is_separator(*p))
                ++p;
        } else {
            while (*p != '\0' && !is_separator(*p))
                clean[out++] = *p++;
        }
    }
    clean[out] = '\0';
    return DPX_OK;
}

dpx_status dpx_read_xfer_buff(cx_os_file_t *file, uint32_t *index, dpx_chunk *buffer, int16_t *last, int16_t max,
                              uint8_t *finished)
{
    TRC1_FUNCTION();
    if (file == nullptr || index == nullptr || buffer == nullptr || last == nullptr || finished == nullptr)
        return DPX_E_INVALID_PARAM;
    dpx_status status = DPX_OK;
    uint32_t next = *index;
    int32_t filled = 0;
    bool at_end = false;
    // At chunk 0 the read starts where the file stands: its start, for a file
    // just opened.
    if (next != 0) {
        uint64_t position = static_cast<uint64_t>(next) * DPX_CHUNK_SIZE;
        if (!cx_succeeded(cx_file_set_pos(file, &position))) {
            TRC1_ERROR_MSG("Can't seek file pos\n");
            status = DPX_E_FILE_SEEK;
        }
    }
    // A short read, 0 bytes included, is the end of the file, and its record
    // is the last one delivered.
    while (filled <= max && status == DPX_OK && !at_end) {
        dpx_chunk &record = buffer[filled];
        size_t got = 0;
        if (!cx_succeeded(cx_file_read_bytes(file, DPX_CHUNK_SIZE, &got, record.data))) {
            TRC1_ERROR_MSG("Can't read file\n");
            status = DPX_E_FILE_READ;
        } else {
            record.index = next++;
            record.length = static_cast<uint32_t>(got);
            at_end = got < DPX_CHUNK_SIZE;
            ++filled;
        }
    }
    // Records filled before a failure are not reported.
    if (status == DPX_OK) {
        *finished = at_end ? 1 : 0;
        *index = next;
        *last = static_cast<int16_t>(filled - 1);
    }
    return status;
}

dpx_status dpx_write_xfer_buff(cx_os_file_t *file, const dpx_chunk *buffer, int16_t last)
{
    TRC1_FUNCTION();
    if (file == nullptr || buffer == nullptr)
        return DPX_E_INVALID_PARAM;
    // Records may come from the wire: one that claims more than its data is
    // refused before any of the buffer reaches the file.
    for (int32_t i = 0; i <= last; ++i) {
        if (buffer[i].length > DPX_CHUNK_SIZE)
            return DPX_E_INVALID_PARAM;
    }
    dpx_status status = DPX_OK;
    // One behind the other at the file's position; `index` is not looked at.
    for (int32_t i = 0; i <= last && status == DPX_OK; ++i) {
        size_t done = 0;
        if (!cx_succeeded(cx_file_write_bytes(file, buffer[i].length, &done, buffer[i].data))) {
            TRC1_ERROR_MSG("Can't write file\n");
            status = DPX_E_FILE_WRITE;
        }
    }
    return status;
}

dpx_status dpx_get_os_file_stats(const char *path, dpx_file_size *size, dpx_file_time *time)
{
    TRC1_FUNCTION();
    if (path == nullptr || size == nullptr || time == nullptr)
        return DPX_E_INVALID_PARAM;
    cx_file_info_t info;
    uint64_t length = 0;
    int32_t seconds = 0;
    cx_status status = cx_named_file_info(path, &info);
    if (cx_succeeded(status))
        status = cx_file_info_size(&info, &length);
    if (cx_succeeded(status))
        status = cx_file_info_last_mod(&info, &seconds);
    if (!cx_succeeded(status))
        return DPX_E_FILE_READ;
    size->chunks = static_cast<uint32_t>(length / DPX_CHUNK_SIZE);
    size->remainder = static_cast<uint32_t>(length % DPX_CHUNK_SIZE);
    time->low = static_cast<uint32_t>(seconds);
    time->high = 0;
    return DPX_OK;
}

dpx_status dpx_init_file_stats(dpx_file_desc *desc, const dpx_file_size *size, const dpx_file_time *time)
{
    TRC1_FUNCTION();
    if (desc == nullptr || size == nullptr || time == nullptr)
        return DPX_E_INVALID_PARAM;
    desc->size = *size;
    desc->mtime = *time;
    return DPX_OK;
}

dpx_status dpx_check_file_stats(const dpx_file_desc *desc, const dpx_file_size *size, const dpx_file_time *time)
{
    TRC1_FUNCTION();
    if (desc == nullptr || size == nullptr || time == nullptr)
        return DPX_E_INVALID_PARAM;
    // All four words, exactly: no tolerance on the time.
    bool same = desc->size.chunks == size->chunks && desc->size.remainder == size->remainder &&
                desc->mtime.low == time->low && desc->mtime.high == time->high;
    return same ? DPX_OK : DPX_E_FILE_CHANGED;
}

}  // extern "C"
