// The channel's thread-free parts: line cutting, line sorting, masking and
// the tokenizer.
#include <gtest/gtest.h>
#include <host/log_capture.h>

#include <algorithm>
#include <cctype>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "at_line.h"
#include "at_tok.h"
#include "atchannel.h"

namespace {

// A byte stream served one piece per read; `eof` pieces make one read give 0.
struct Piece {
  std::string data;
  bool eof = false;
  bool fail = false;
};

struct Script {
  std::vector<Piece> pieces;
  size_t idx = 0;
  size_t off = 0;
  int reads = 0;
};

int32_t scriptRead(void* arg, char* dest, int32_t max_len) {
  auto* s = static_cast<Script*>(arg);
  ++s->reads;
  for (; s->idx < s->pieces.size(); ++s->idx, s->off = 0) {
    const Piece& p = s->pieces[s->idx];
    if (p.fail || p.eof) {
      ++s->idx;
      return p.fail ? -1 : 0;
    }
    size_t n = std::min(p.data.size() - s->off, static_cast<size_t>(max_len));
    if (n == 0) continue;
    memcpy(dest, p.data.data() + s->off, n);
    s->off += n;
    return static_cast<int32_t>(n);
  }
  return 0;
}

struct Cutter {
  char buf[AT_LINE_BUF_SIZE];
  char* cur;
  char* end;
  Cutter() { at_line_reset(buf, &cur, &end); }
  int32_t next(Script& s, std::string* line) {
    char* out = nullptr;
    int32_t rc = at_line_next(buf, &cur, &end, scriptRead, &s, &out);
    if (rc == AT_LINE_READY) *line = out;
    return rc;
  }
};

// Every line up to the end of the script, going on after single EOFs.
std::vector<std::string> allLines(Script s) {
  Cutter c;
  std::vector<std::string> lines;
  std::string line;
  while (true) {
    int32_t rc = c.next(s, &line);
    if (rc == AT_LINE_READY) {
      lines.push_back(line);
    } else if (rc == AT_LINE_EOF && s.idx < s.pieces.size()) {
      continue;
    } else {
      break;
    }
  }
  return lines;
}

Script cutAt(const std::string& stream, std::vector<size_t> cuts) {
  Script s;
  size_t from = 0;
  cuts.push_back(stream.size());
  for (size_t c : cuts) {
    s.pieces.push_back({stream.substr(from, c - from)});
    from = c;
  }
  return s;
}

const char kShortRaw[] =
    "\r\n^CARDTYPE: 1,1,0\r\n\r\nOK\r\n"
    "+CGLA: 4,\"9000\"\rOK\n"
    "AB\0CD\r\n"
    "\n\n\nERROR\r\n"
    "+CMT: 1\r\n0891\r\n"
    "> ";
const std::string kShortStream(kShortRaw, sizeof(kShortRaw) - 1);

const std::vector<std::string> kShortLines = {
    "^CARDTYPE: 1,1,0", "OK", "+CGLA: 4,\"9000\"", "OK", "ABCD", "ERROR", "+CMT: 1", "0891", ">"};

// Read boundaries that matter: a byte either side of every line end, NUL and
// prompt, and of where a line fills the buffer.
std::vector<size_t> cutsThatMatter(const std::string& stream) {
  std::vector<size_t> marks;
  size_t lineStart = 0;
  for (size_t i = 0; i <= stream.size(); ++i) {
    const char c = i < stream.size() ? stream[i] : '\n';
    if (i - lineStart == static_cast<size_t>(AT_LINE_BUF_DATA)) marks.push_back(i);
    if (c == '\r' || c == '\n' || c == '\0' || c == '>') marks.push_back(i);
    if (c == '\r' || c == '\n') lineStart = i + 1;
  }
  std::vector<size_t> cuts;
  for (size_t m : marks)
    for (size_t k = m > 0 ? m - 1 : 0; k <= m + 2 && k <= stream.size(); ++k)
      if (cuts.empty() || cuts.back() < k) cuts.push_back(k);
  return cuts;
}

TEST(LineCutter, CutsAroundLineEndsKeepTheLines) {
  const std::vector<size_t> cuts = cutsThatMatter(kShortStream);
  for (size_t i : cuts) {
    for (size_t j : cuts) {
      if (i > j) continue;
      ASSERT_EQ(allLines(cutAt(kShortStream, {i, j})), kShortLines) << i << "," << j;
    }
  }
  std::vector<size_t> everyByte;
  for (size_t i = 1; i < kShortStream.size(); ++i) everyByte.push_back(i);
  EXPECT_EQ(allLines(cutAt(kShortStream, everyByte)), kShortLines);
}

TEST(LineCutter, CutsAroundOverlongLinesKeepTheLines) {
  android::host::LogCapture cap;
  // A line one byte short of the limit survives; a line at the limit loses
  // its first 8192 bytes and what follows comes out as a line.
  const std::string stream = "X\r\n" + std::string(8191, 'M') + "\r\n" + std::string(8192, 'L') +
                             "tail\r\n\r\nOK\r\n";
  const std::vector<std::string> want = {"X", std::string(8191, 'M'), "tail", "OK"};
  for (size_t i : cutsThatMatter(stream)) ASSERT_EQ(allLines(cutAt(stream, {i})), want) << "cut " << i;
  EXPECT_TRUE(cap.contains("ERROR: Input line exceeded buffer", "atchannel"));
}

TEST(LineCutter, EdgeCases) {
  struct Case {
    const char* name;
    std::vector<Piece> pieces;
    std::vector<std::string> lines;
  };
  const std::vector<Case> cases = {
      {"crlf around OK", {{"\r\nOK\r\n"}}, {"OK"}},
      {"prompt alone", {{"> "}}, {">"}},
      {"prompt split", {{">"}, {" "}}, {">"}},
      {"prompt with more text is a plain line", {{"> x\r\n"}}, {"> x"}},
      {"line over two reads", {{"+CCHO"}, {": 7\r\n"}}, {"+CCHO: 7"}},
      {"partial line across an end of file", {{"PAR"}, {"", true}, {"TIAL\r\n"}}, {"PARTIAL"}},
      {"lone CR and LF runs give no empty lines", {{"\r\r\n\n"}, {"\nA\r"}, {"\n\rB\n"}}, {"A", "B"}},
      {"NUL bytes only", {{std::string("\0\0", 2)}, {"C\r\n"}}, {"C"}},
  };
  for (const Case& c : cases) {
    Script s;
    s.pieces = c.pieces;
    EXPECT_EQ(allLines(s), c.lines) << c.name;
  }
}

// Lines of one read come out without reading again; a failed read is told.
TEST(LineCutter, ReadsOnlyWhenNeeded) {
  Script s;
  s.pieces = {{"+CCHO: 7\r\nOK\r\n"}, {"PART"}, {"", false, true}};
  Cutter c;
  std::string line;
  for (const char* want : {"+CCHO: 7", "OK"}) {
    ASSERT_EQ(c.next(s, &line), AT_LINE_READY);
    EXPECT_EQ(line, want);
  }
  EXPECT_EQ(s.reads, 1);
  EXPECT_EQ(c.next(s, &line), AT_LINE_READ_ERROR);
}

TEST(LineSorting, Table) {
  struct Case {
    const char* line;
    int32_t pending;
    int32_t type;
    int32_t hasIntermediate;
    const char* prefix;
    AtLineKind want;
  };
  const Case cases[] = {
      {"OK", 0, at_type_none, 0, nullptr, AT_KIND_UNSOLICITED},
      {"OK", 1, at_type_none, 0, nullptr, AT_KIND_FINAL_SUCCESS},
      {"ok", 1, at_type_none, 0, nullptr, AT_KIND_UNSOLICITED},
      {"CONNECT 9600", 1, at_type_none, 0, nullptr, AT_KIND_FINAL_SUCCESS},
      {"+CME ERROR: 4", 1, at_type_singleline, 0, "+CME", AT_KIND_FINAL_ERROR},
      {"COMMAND NOT SUPPORT", 1, at_type_none, 0, nullptr, AT_KIND_FINAL_ERROR},
      {"NO CARRIER", 1, at_type_none, 0, nullptr, AT_KIND_FINAL_ERROR},
      {"error", 1, at_type_none, 0, nullptr, AT_KIND_UNSOLICITED},
      {"^CARDTYPE: 1,1,0", 1, at_type_singleline, 0, "^CARDTYPE:", AT_KIND_INTERMEDIATE},
      {"^CARDTYPE: 1,1,0", 1, at_type_singleline, 1, "^CARDTYPE:", AT_KIND_UNSOLICITED},
      {"^CARDTYPE: 1,1,0", 1, at_type_none, 0, "^CARDTYPE:", AT_KIND_UNSOLICITED},
      {"^CARDTYPE: 1,1,0", 1, at_type_singleline, 0, nullptr, AT_KIND_UNSOLICITED},
      {"+CREG: 1", 1, at_type_singleline, 0, "^CARDTYPE:", AT_KIND_UNSOLICITED},
      {"^CARDTYPE:", 1, at_type_singleline, 0, "^CARDTYPE:", AT_KIND_INTERMEDIATE},
      {"^CARDTYP", 1, at_type_singleline, 0, "^CARDTYPE:", AT_KIND_UNSOLICITED},
      // Real modems: the echoed command (ATE1) is never its own answer, the
      // verbose error form (AT+CMEE=2) ends a command, and the unsolicited
      // reports of common modems between an answer's lines stay unsolicited.
      {"AT+CGLA=257,10,\"0001000001\"", 1, at_type_singleline, 0, "+CGLA:", AT_KIND_UNSOLICITED},
      {"AT+CCHO=\"A00000000101\"", 1, at_type_singleline_or_numeric, 0, "+CCHO:", AT_KIND_UNSOLICITED},
      {"AT+CPIN?", 1, at_type_singleline, 0, "+CPIN:", AT_KIND_UNSOLICITED},
      {"+CME ERROR: SIM not inserted", 1, at_type_singleline, 0, "+CPIN:", AT_KIND_FINAL_ERROR},
      {"+CPIN: SIM PIN", 1, at_type_singleline, 0, "+CPIN:", AT_KIND_INTERMEDIATE},
      {"RING", 1, at_type_singleline_or_numeric, 0, "+CCHO:", AT_KIND_UNSOLICITED},
      {"^BOOT:20975085,0,0,0,75", 1, at_type_singleline, 1, "+CGLA:", AT_KIND_UNSOLICITED},
      {"+CMTI: \"SM\",3", 1, at_type_singleline, 0, "+CSIM:", AT_KIND_UNSOLICITED},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(at_classify_line(c.line, c.pending, c.type, c.hasIntermediate, c.prefix), c.want)
        << c.line << " pending=" << c.pending << " type=" << c.type;
  }
  for (const char* sms : {"+CMT: 1", "^BST: x", "+CDS: 2", "+CBM: 3"}) EXPECT_TRUE(at_is_sms_unsolicited(sms));
  for (const char* other : {"+CMTI: 1", "+cmt: 1"}) EXPECT_FALSE(at_is_sms_unsolicited(other));
}

TEST(Masking, WordsAreFoundInTableOrderWithoutRegardToCase) {
  struct Case {
    const char* text;
    const char* word;  // null: logged in clear
  };
  const Case cases[] = {
      {"AT+CCHO=\"A0000000031010\"", "CCHO="},
      {"AT+CCHP=\"A000\",4", "CCHP="},
      {"AT+CGLA=1,10,\"00A4040005\"", "CGLA"},
      {"AT+CSIM=10,\"00B0\"", "CSIM="},
      {"+CSIM: 4,\"6A82\"", "CSIM:"},
      {"at+cpin2=1234", "CPIN2="},
      {"+CLCCECONF: 1", "CLCC"},   // CLCC comes before CLCCECONF in the table
      {"ATD123;", "ATD"},
      {"x cgcontrdp y", "CGCONTRDP"},
      {"AT^CARDTYPE?", nullptr},
      {"+CCHO: 7", nullptr},
      {"", nullptr},
  };
  for (const Case& c : cases) EXPECT_STREQ(c.word, at_mask_find(c.text)) << c.text;
}

// The search runs once over the text; it must still give the word that
// comes first in the table, wherever in the text each word stands. Checked
// against the plain word-by-word search on texts mixed from word pieces.
TEST(Masking, SinglePassAgreesWithWordByWordSearch) {
  auto plain = [](const std::string& text) -> const char* {
    std::string low = text;
    for (char& ch : low) ch = static_cast<char>(tolower(static_cast<unsigned char>(ch)));
    for (const char* word : at_mask_words) {
      std::string w = word;
      for (char& ch : w) ch = static_cast<char>(tolower(static_cast<unsigned char>(ch)));
      if (low.find(w) != std::string::npos) return word;
    }
    return nullptr;
  };
  const char* const pieces[] = {"+CGLA: 514,\"", "0A1B", "crs", "M", "CLC", "c", "ECONF", "CSIM", ":",
                                "=", "\"", " ", "VOLTEIMP", "I:", "CPIN2", "DMC", "N", "\xC3\xA9"};
  uint32_t seed = 12345;
  for (int n = 0; n < 5000; ++n) {
    std::string text;
    for (int k = 0; k < 12; ++k) {
      seed = seed * 1103515245u + 12345u;
      text += pieces[(seed >> 16) % (sizeof(pieces) / sizeof(pieces[0]))];
    }
    ASSERT_STREQ(plain(text), at_mask_find(text.c_str())) << text;
  }
}

TEST(Tokenizer, Table) {
  // Each step: 'i' reads an int, 's' a text; want_rc and the value or text.
  struct Step {
    char op;
    int32_t rc;
    int32_t ival;
    const char* sval;
  };
  struct Case {
    const char* line;
    int32_t start_rc;
    std::vector<Step> steps;
  };
  const std::vector<Case> cases = {
      {"^CARDTYPE: 1,1,0", 0, {{'i', 0, 1, nullptr}, {'i', 0, 1, nullptr}, {'i', 0, 0, nullptr}, {'i', -1, 99, nullptr}}},
      {"+CGLA: 4,\"9000\"", 0, {{'i', 0, 4, nullptr}, {'s', 0, 0, "9000"}, {'s', 0, 0, ""}, {'s', -1, 0, nullptr}}},
      {"+X: AB,12AB,0x1F,-5", 0, {{'i', -1, 0, nullptr}, {'i', 0, 12, nullptr}, {'i', 0, 0, nullptr}, {'i', 0, -5, nullptr}}},
      {"+X:   \t\"a b\" junk ,  c d", 0, {{'s', 0, 0, "a b"}, {'s', 0, 0, "c d"}, {'s', -1, 0, nullptr}}},
      {"+X: \"open", 0, {{'s', 0, 0, "open"}, {'s', -1, 0, nullptr}}},
      {"+X: ,", 0, {{'s', 0, 0, ""}, {'s', 0, 0, ""}, {'s', -1, 0, nullptr}}},
      {"+X: 4294967297", 0, {{'i', 0, 1, nullptr}}},
      {"no colon here", -1, {{'i', -1, 99, nullptr}, {'s', -1, 0, nullptr}}},
  };
  for (const Case& c : cases) {
    std::string text = c.line;
    char* cur = &text[0];
    EXPECT_EQ(at_tok_start(&cur), c.start_rc) << c.line;
    if (c.start_rc < 0) {
      EXPECT_EQ(cur, nullptr) << c.line;
    }
    for (size_t i = 0; i < c.steps.size(); ++i) {
      SCOPED_TRACE(::testing::Message() << c.line << " step " << i);
      const Step& s = c.steps[i];
      int32_t v = 99;
      char* out = nullptr;
      EXPECT_EQ(s.op == 'i' ? at_tok_nextint(&cur, &v) : at_tok_nextstr(&cur, &out), s.rc);
      EXPECT_EQ(s.op == 'i' ? s.ival : 99, v);
      if (s.sval != nullptr) {
        EXPECT_STREQ(s.sval, out);
      }
    }
  }
  EXPECT_EQ(at_tok_start(nullptr), -1);
  char* none = nullptr;
  int32_t v = 0;
  EXPECT_EQ(at_tok_nextint(&none, &v), -1);
  EXPECT_EQ(at_tok_nextstr(&none, nullptr), -1);
}

TEST(CmeError, Table) {
  const std::pair<const char*, int32_t> cases[] = {{"OK", 0},      {"+CME ERROR: 716,extra", 716}, {"+CME ERROR: x", -1},
                                                   {"ERROR", -1},  {"+cme error: 4", -1},          {nullptr, -1}};
  for (const auto& c : cases) {
    std::string text = c.first ? c.first : "";
    ATResponse r = {};
    r.success = c.second == 0 ? 1 : 0;
    r.final_response = c.first ? &text[0] : nullptr;
    EXPECT_EQ(at_get_cme_error(&r), c.second) << (c.first ? c.first : "(none)");
  }
  EXPECT_EQ(at_get_cme_error(nullptr), -1);
  at_response_free(nullptr);
}

}  // namespace
