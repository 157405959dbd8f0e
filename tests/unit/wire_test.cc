// The bytes of the bodies of dpx_transfer version 1: the NDR primitives, the
// offset of every field of the eight bodies, and their lengths.
#include "dpxagt.h"
#include "foreign_body.h"
#include "stub_peer.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>

using namespace dpxtest;

namespace {

ncs::ndr::Reader reader_of(const unsigned char *body, size_t length, uint32_t sender, uint32_t local = NCS_DREP_LOCAL)
{
    return ncs::ndr::Reader(body, static_cast<uint32_t>(length), sender, local, NRTR1_AsciiToEbcdic(),
                            NRTR1_EbcdicToAscii());
}

constexpr uint32_t kBigAscii = NCS_DREP(NCS_INT_BIG, NCS_CHAR_ASCII, 0);
constexpr uint32_t kEbcdic = NCS_DREP_LOCAL | NCS_DREP(0, NCS_CHAR_EBCDIC, 0);

// ---- NDR primitives ---------------------------------------------------------

TEST(NdrWriter, AlignsFromTheBodyStartAndWritesGapsAsZero)
{
    unsigned char packet[40];
    std::memset(packet, 0xEE, sizeof packet);
    ncs::ndr::Writer writer(packet + 3);  // a body at an odd address
    writer.put_u8(0x11);
    writer.put_u16(0x2233);
    writer.put_u8(0x44);
    writer.put_u32(0x55667788);
    writer.put_chars("ab", 2);
    writer.put_u8(0x99);
    writer.put_u16(0xAABB);
    ASSERT_EQ(writer.length(), 18u);
    const unsigned char *body = packet + 3;
    for (int gap : {1, 5, 6, 7, 15})
        EXPECT_EQ(body[gap], 0) << "gap at " << gap;
    uint16_t u16;
    uint32_t u32;
    std::memcpy(&u16, body + 2, 2);
    std::memcpy(&u32, body + 8, 4);
    EXPECT_EQ(u16, 0x2233);
    EXPECT_EQ(u32, 0x55667788u);
    EXPECT_EQ(std::memcmp(body + 12, "ab", 2), 0);
    EXPECT_EQ(body[18], 0xEE) << "nothing trails the last field";
}

TEST(NdrReader, SameRepresentationReadsBackWhatTheWriterWrote)
{
    unsigned char body[16];
    ncs::ndr::Writer writer(body);
    writer.put_u8(7);
    writer.put_u32(0xC1C2C3C4);
    writer.put_u16(0xFFFE);
    writer.put_chars("\xC1z", 2);
    for (uint32_t sender : {NCS_DREP_LOCAL, NCS_DREP_LOCAL | NCS_DREP(0, 0, 1)}) {  // float_rep alone differs
        ncs::ndr::Reader reader = reader_of(body, writer.length(), sender);
        EXPECT_EQ(reader.get_u8(), 7);
        EXPECT_EQ(reader.get_u32(), 0xC1C2C3C4u);
        EXPECT_EQ(reader.get_i16(), -2);
        char text[2];
        reader.get_chars(text, 2);
        EXPECT_EQ(std::memcmp(text, "\xC1z", 2), 0);
    }
}

TEST(NdrReader, OtherByteOrderReversesIntegersAndLeavesBytesAlone)
{
    const unsigned char body[] = {0xAB, 0x00, 0x12, 0x34, 0x01, 0x02, 0x03, 0x04, 0x12, 0x34};
    ncs::ndr::Reader reader = reader_of(body, sizeof body, kBigAscii);
    EXPECT_EQ(reader.get_u8(), 0xAB);
    EXPECT_EQ(reader.get_u16(), 0x1234);
    EXPECT_EQ(reader.get_u32(), 0x01020304u);
    unsigned char bytes[2];
    reader.get_bytes(bytes, 2);
    EXPECT_EQ(bytes[0], 0x12);
    EXPECT_EQ(bytes[1], 0x34);
}

TEST(NdrReader, OtherCharacterSetTranslatesCharactersOnlyWithTheTableOfTheReader)
{
    const unsigned char ebcdic[] = {0xC1, 0xC2, 0xF1, 0x40, 0xC1};
    ncs::ndr::Reader from_ebcdic = reader_of(ebcdic, sizeof ebcdic, kEbcdic);
    char text[4];
    from_ebcdic.get_chars(text, 4);
    EXPECT_EQ(std::string(text, 4), "AB1 ");
    unsigned char byte;
    from_ebcdic.get_bytes(&byte, 1);
    EXPECT_EQ(byte, 0xC1) << "bytes are never translated";

    const unsigned char ascii[] = {'A', 'B', '1', ' '};
    ncs::ndr::Reader on_ebcdic = reader_of(ascii, sizeof ascii, NCS_DREP_LOCAL, kEbcdic);
    on_ebcdic.get_chars(text, 4);
    EXPECT_EQ(std::string(text, 4), "\xC1\xC2\xF1\x40");
}

TEST(NdrReader, RaisesInvalidBoundAtTheReceivedLengthAndReadsNothingBehindIt)
{
    // u8, gap, u16, u32, 3 characters: 11 bytes.
    for (size_t length = 0; length <= 11; ++length) {
        std::unique_ptr<unsigned char[]> body(new unsigned char[length]);
        std::memset(body.get(), 0x5A, length);
        for (uint32_t sender : {NCS_DREP_LOCAL, kBigAscii | NCS_DREP(0, NCS_CHAR_EBCDIC, 0)}) {
            ncs::ndr::Reader reader = reader_of(body.get(), length, sender);
            const uint32_t raised = raised_status([&] {
                reader.get_u8();
                reader.get_u16();
                reader.get_u32();
                char text[3];
                reader.get_chars(text, 3);
            });
            EXPECT_EQ(raised, length < 11 ? DPX_RPC_FAULT_INVALID_BOUND : 0u) << "length " << length;
        }
    }
}

// ---- Body layouts ------------------------------------------------------------

class BodyLayout : public ::testing::Test {
protected:
    void SetUp() override { manager_script() = ManagerScript{}; }
};

// The requests that the server stubs read, at the offsets of the tables, and
// the replies they write.
TEST_F(BodyLayout, GetChunksRequestAndReplyHoldEveryFieldAtItsOffset)
{
    Message request;
    request.desc = sample_desc("dir/file.txt");
    request.crc = 0xDEADBEEF;
    request.state = DPX_STATE_MORE;
    request.index = 0x00010203;
    request.last = 2;
    request.max = 23;
    request.chunks = sample_chunks(3, 0x00010200);
    manager_script().answer = [](Message &m) {
        m.desc.size = {9, 10};
        m.crc = 0x0BADF00D;
        m.state = DPX_STATE_DONE;
        m.index = 0x11223344;
        m.last = 4;
        m.status = 0xF11E0007;
        m.chunks = sample_chunks(5, 77);
    };
    ServerReply reply =
        call_server_stub(dpx_get_chunks_ssr, encode(kGetChunksRequest, request, local_rep()), local_rep());

    const Message &seen = manager_script().seen;
    EXPECT_TRUE(same_desc(seen.desc, request.desc));
    EXPECT_EQ(seen.crc, request.crc);
    EXPECT_EQ(seen.state, request.state);
    EXPECT_EQ(seen.index, request.index);
    EXPECT_EQ(seen.last, 2);
    EXPECT_EQ(seen.max, 23);
    EXPECT_TRUE(same_chunks(request.chunks, seen.chunks.data(), 3));

    ASSERT_EQ(reply.body.size(), 4176u + 5 * 4104);
    Message answer = decode(kGetChunksReply, reply.body, local_rep());
    dpx_file_desc desc = request.desc;
    desc.size = {9, 10};
    EXPECT_TRUE(same_desc(answer.desc, desc));
    EXPECT_EQ(answer.crc, 0x0BADF00Du);
    EXPECT_EQ(answer.state, DPX_STATE_DONE);
    EXPECT_EQ(answer.index, 0x11223344u);
    EXPECT_EQ(answer.last, 4);
    EXPECT_EQ(answer.status, 0xF11E0007u);
    EXPECT_EQ(*answer.size_word, 24);
    EXPECT_EQ(*answer.count_word, 5);
    EXPECT_TRUE(same_chunks(sample_chunks(5, 77), answer.chunks.data(), 5));
}

TEST_F(BodyLayout, PutChunksRequestAndReplyHoldEveryFieldAtItsOffset)
{
    for (int16_t last : {-1, 0, 3}) {
        Message request;
        request.desc = sample_desc("up/load");
        request.crc = 0xCAFEBABE;
        request.state = DPX_STATE_DONE;
        request.last = last;
        request.max = 127;
        request.chunks = sample_chunks(static_cast<size_t>(last + 1), 5);
        manager_script().answer = [](Message &m) { m.status = 0xF11E0014; };
        ServerReply reply =
            call_server_stub(dpx_put_chunks_ssr, encode(kPutChunksRequest, request, local_rep()), local_rep());

        const Message &seen = manager_script().seen;
        EXPECT_TRUE(same_desc(seen.desc, request.desc));
        EXPECT_EQ(seen.crc, request.crc);
        EXPECT_EQ(seen.state, request.state);
        EXPECT_EQ(seen.last, last);
        EXPECT_EQ(seen.max, 127);
        EXPECT_TRUE(same_chunks(request.chunks, seen.chunks.data(), seen.chunks.size()));

        Message answer = decode(kPutChunksReply, reply.body, local_rep());
        EXPECT_EQ(reply.body.size(), 12u + 4104 * (last + 1));
        EXPECT_EQ(answer.last, last);
        EXPECT_EQ(answer.status, 0xF11E0014u);
        EXPECT_EQ(*answer.size_word, 128);
        EXPECT_TRUE(same_chunks(request.chunks, answer.chunks.data(), answer.chunks.size()))
            << "the records go back as they came";
    }
}

TEST_F(BodyLayout, AgentQueryRequestAndReplyHoldEveryFieldAtItsOffset)
{
    Message request;
    request.query = std::string(1000, 'q') + "\xE4?";
    request.desc = sample_desc("query/path");
    manager_script().answer = [](Message &m) {
        m.result = 0x01020304;
        m.status = DPX_E_INVALID_PARAM;
    };
    std::vector<unsigned char> body = encode(kAgentQueryRequest, request, local_rep());
    ASSERT_EQ(body.size(), 5173u);
    ServerReply reply = call_server_stub(dpx_agent_query_ssr, body, local_rep());

    EXPECT_EQ(manager_script().seen.query, request.query);
    EXPECT_TRUE(same_desc(manager_script().seen.desc, request.desc));
    Message answer = decode(kAgentQueryReply, reply.body, local_rep());
    EXPECT_EQ(reply.body.size(), 8u);
    EXPECT_EQ(answer.result, 0x01020304u);
    EXPECT_EQ(answer.status, DPX_E_INVALID_PARAM);
}

TEST_F(BodyLayout, ListNodesRequestAndReplyHoldEveryFieldAtItsOffset)
{
    Message request;
    request.filter = "filter-16-chars!";
    request.last = 1;
    request.max = 127;
    request.nodes = {"alpha", std::string(33, 'z')};
    manager_script().answer = [](Message &m) {
        m.last = 2;
        m.status = 0x1234;
        m.nodes = {"one", "two", "three"};
    };
    ServerReply reply =
        call_server_stub(dpx_list_nodes_ssr, encode(kListNodesRequest, request, local_rep()), local_rep());

    EXPECT_EQ(manager_script().seen.filter, request.filter);
    EXPECT_EQ(manager_script().seen.nodes, request.nodes);
    Message answer = decode(kListNodesReply, reply.body, local_rep());
    EXPECT_EQ(reply.body.size(), 12u + 33 * 3);
    EXPECT_EQ(answer.last, 2);
    EXPECT_EQ(answer.status, 0x1234u);
    EXPECT_EQ(*answer.size_word, 128);
    EXPECT_EQ(answer.nodes, (std::vector<std::string>{"one", "two", "three"}));
}

// The requests that the client stubs write: every field at its offset, gaps
// zero.
TEST_F(BodyLayout, ClientStubsWriteEveryRequestFieldAtItsOffsetWithZeroGaps)
{
    StubPeer peer;
    dpx_file_desc desc = sample_desc("client/side");
    std::vector<dpx_chunk> buffer = sample_chunks(24, 40);
    uint32_t crc = 0x89ABCDEF;
    uint8_t state = DPX_STATE_MORE;
    uint32_t index = 0x00C0FFEE;
    int16_t last = 2;
    dpx_status status = 0;

    dpx_get_chunks_csr(peer.handle(), &desc, &crc, &state, &index, &last, 23, &status, buffer.data());
    Message get = decode(kGetChunksRequest, peer.request, local_rep());
    EXPECT_TRUE(same_desc(get.desc, sample_desc("client/side")));
    EXPECT_EQ(get.crc, 0x89ABCDEFu);
    EXPECT_EQ(get.state, DPX_STATE_MORE);
    EXPECT_EQ(get.index, 0x00C0FFEEu);
    EXPECT_EQ(get.last, 2);
    EXPECT_EQ(get.max, 23);
    EXPECT_EQ(*get.size_word, 24);
    EXPECT_TRUE(same_chunks(get.chunks, sample_chunks(3, 40).data(), 3));

    last = 1;
    dpx_put_chunks_csr(peer.handle(), desc, 0x13579BDF, DPX_STATE_DONE, &last, 23, &status, buffer.data());
    Message put = decode(kPutChunksRequest, peer.request, local_rep());
    EXPECT_TRUE(same_desc(put.desc, sample_desc("client/side")));
    EXPECT_EQ(put.crc, 0x13579BDFu);
    EXPECT_EQ(put.state, DPX_STATE_DONE);
    EXPECT_EQ(put.last, 1);
    EXPECT_EQ(put.max, 23);
    EXPECT_TRUE(same_chunks(put.chunks, sample_chunks(2, 40).data(), 2));

    dpx_query_text query = "what?";
    uint32_t result = 0;
    dpx_agent_query_csr(peer.handle(), query, desc, &result, &status);
    Message asked = decode(kAgentQueryRequest, peer.request, local_rep());
    EXPECT_EQ(asked.query, "what?");
    EXPECT_TRUE(same_desc(asked.desc, sample_desc("client/side")));

    dpx_node_filter filter = "node*";
    dpx_node_name nodes[4] = {"first", "second"};
    last = 1;
    dpx_list_nodes_csr(peer.handle(), filter, &last, 3, &status, nodes);
    Message listed = decode(kListNodesRequest, peer.request, local_rep());
    EXPECT_EQ(listed.filter, "node*");
    EXPECT_EQ(listed.last, 1);
    EXPECT_EQ(listed.max, 3);
    EXPECT_EQ(*listed.size_word, 4);
    EXPECT_EQ(listed.nodes, (std::vector<std::string>{"first", "second"}));
}

// ---- Sizes in use --------------------------------------------------------------

struct SizeRow {
    uint32_t opnum;
    int16_t n;
    size_t request;
    size_t reply;
};

std::string size_row_name(const ::testing::TestParamInfo<SizeRow> &info)
{
    static const char *const kOperations[] = {"get_chunks", "put_chunks", "agent_query", "list_nodes"};
    return std::string(kOperations[info.param.opnum]) + "_" + std::to_string(info.param.n);
}

class BodySizes : public ::testing::TestWithParam<SizeRow> {};

// Each request is written by the client stub with n elements and max 127,
// and its reply by the server stub with the n elements left as they came.
TEST_P(BodySizes, RequestAndReplyLengthsFollowTheSizesTable)
{
    const SizeRow row = GetParam();
    StubPeer peer;
    dpx_file_desc desc = sample_desc("sizes");
    std::vector<dpx_chunk> buffer(128);
    std::unique_ptr<dpx_node_name[]> nodes(new dpx_node_name[128]());
    int16_t last = static_cast<int16_t>(row.n - 1);
    dpx_status status = 0;
    uint32_t crc = 0, index = 0, result = 0;
    uint8_t state = 0;
    dpx_query_text query = {};
    dpx_node_filter filter = {};
    switch (row.opnum) {
    case DPX_OP_GET_CHUNKS:
        dpx_get_chunks_csr(peer.handle(), &desc, &crc, &state, &index, &last, 127, &status, buffer.data());
        break;
    case DPX_OP_PUT_CHUNKS:
        dpx_put_chunks_csr(peer.handle(), desc, crc, state, &last, 127, &status, buffer.data());
        break;
    case DPX_OP_AGENT_QUERY: dpx_agent_query_csr(peer.handle(), query, desc, &result, &status); break;
    default: dpx_list_nodes_csr(peer.handle(), filter, &last, 127, &status, nodes.get()); break;
    }
    ASSERT_EQ(peer.requests, 1);
    EXPECT_EQ(peer.request.size(), row.request);
    ServerReply reply = call_server_stub(dpx_transfer_v1_server_epva[row.opnum], peer.request, local_rep(), 0);
    EXPECT_EQ(reply.body.size(), row.reply);
}

INSTANTIATE_TEST_SUITE_P(SizesInUse, BodySizes,
                         ::testing::Values(SizeRow{DPX_OP_GET_CHUNKS, 0, 4172, 4176},
                                           SizeRow{DPX_OP_GET_CHUNKS, 24, 102668, 102672},
                                           SizeRow{DPX_OP_GET_CHUNKS, 128, 529484, 529488},
                                           SizeRow{DPX_OP_PUT_CHUNKS, 0, 4166, 12},
                                           SizeRow{DPX_OP_PUT_CHUNKS, 24, 102664, 98508},
                                           SizeRow{DPX_OP_PUT_CHUNKS, 128, 529480, 525324},
                                           SizeRow{DPX_OP_AGENT_QUERY, 0, 5173, 8},
                                           SizeRow{DPX_OP_LIST_NODES, 0, 24, 12},
                                           SizeRow{DPX_OP_LIST_NODES, 24, 816, 804},
                                           SizeRow{DPX_OP_LIST_NODES, 128, 4248, 4236}),
                         size_row_name);

TEST(InterfaceSpec, HoldsTheInterfacesIdentityInItsEightyEightBytes)
{
    const auto *bytes = reinterpret_cast<const unsigned char *>(&dpx_transfer_v1_if_spec);
    EXPECT_EQ(dpx_transfer_v1_if_spec.vers, 1u);
    for (int family = 0; family < 32; ++family)
        EXPECT_EQ(dpx_transfer_v1_if_spec.port[family], 0);
    EXPECT_EQ(dpx_transfer_v1_if_spec.opcnt, 4);
    EXPECT_EQ(dpx_transfer_v1_if_spec.gap, 0);
    EXPECT_EQ(dpx_transfer_v1_if_spec.id.time_high, 0xC00947AEu);
    EXPECT_EQ(dpx_transfer_v1_if_spec.id.time_low, 0);
    EXPECT_EQ(dpx_transfer_v1_if_spec.id.reserved, 0);
    const unsigned char tail[] = {0x22, 0x04, 0x00, 0x00, 0x00, 0xC0, 0xA8, 0x00};
    EXPECT_EQ(std::memcmp(bytes + 80, tail, sizeof tail), 0);
    char text[37];
    uuid__encode(&dpx_transfer_v1_if_spec.id, text);
    EXPECT_STREQ(text, "c00947ae0000.22.04.00.00.00.c0.a8.00");

    EXPECT_EQ(dpx_transfer_v1_client_epv_locator(), &dpx_transfer_v1_client_epv);
    EXPECT_EQ(dpx_transfer_v1_client_epv.dpx_put_chunks, &dpx_put_chunks_csr);
    EXPECT_EQ(dpx_transfer_v1_server_epv_locator(), dpx_transfer_v1_server_epv);
    EXPECT_EQ(dpx_transfer_v1_server_epv[DPX_OP_LIST_NODES], &dpx_list_nodes_ssr);
}

}  // namespace
