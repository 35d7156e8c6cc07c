// Every host operation becomes a hook that counts the call, applies a
// failure or int answer, and otherwise calls its entry of the "next" table:
// the previous operation or a typed answer.
#include "support/fake_host.h"

#include <string.h>

#include <algorithm>
#include <type_traits>
#include <vector>

#include "host_error.h"
#include "share_db.h"

namespace quvahost::test {
namespace {

struct OpState {
  int calls = 0;
  bool fail = false;
  int fail_code = 0, fail_result = -1;
  std::vector<int> answers;  // the last repeats
  size_t next_answer = 0;
  std::string text;  // typed text answer
};

struct FakeState {
  HostOps previous{}, next{};
  OpState ops[static_cast<int>(HostOp::kCount)];
  QLIBCFileStatRecord stat_record{};
  int outstanding_records = 0;
  bool records_on_failure = false;  // failed lookups hand out a record
};

FakeState* g_state = nullptr;

OpState& Op(HostOp op) { return g_state->ops[static_cast<int>(op)]; }

// After a share lookup: what a failed one leaves in *record (null, or a
// blank record when the fake plays a host that hands one out all the same),
// and the count of records handed out.
template <typename T>
void AfterLookup(bool, T) {}
void AfterLookup(bool failed, ShareRecord** record) {
  if (record == nullptr) return;
  if (failed) {
    int error = 0;
    *record = g_state->records_on_failure ? NewShareRecord("", "", 0, &error)
                                          : nullptr;
  }
  if (*record != nullptr) ++g_state->outstanding_records;
}

template <HostOp kOp, typename Fn>
struct HookFor;

template <HostOp kOp, typename R, typename... A>
struct HookFor<kOp, R (*)(A...)> {
  template <R (*HostOps::*kSlot)(A...)>
  static R Call(A... args) {
    OpState& op = Op(kOp);
    ++op.calls;
    if (op.fail) {
      (AfterLookup(true, args), ...);
      HostFail(op.fail_code, __FILE__, __LINE__);
      if constexpr (std::is_pointer_v<R>) return nullptr;
      if constexpr (!std::is_pointer_v<R>) return R(op.fail_result);
    }
    if constexpr (std::is_same_v<R, int>) {
      if (!op.answers.empty()) {
        int answer = op.answers[op.next_answer];
        if (op.next_answer + 1 < op.answers.size()) ++op.next_answer;
        return answer;
      }
      int result = (g_state->next.*kSlot)(args...);
      (AfterLookup(result != 0, args), ...);
      return result;
    } else {
      return (g_state->next.*kSlot)(args...);
    }
  }
};

// The hook of every operation of QUVAHOST_OPS, matched to its slot by name.
constexpr HostOps kHooks = {
#define QUVAHOST_FAKE_HOOK(prefix, name, result, params, args) \
  &HookFor<HostOp::k##name, decltype(HostOps::name)>::Call<&HostOps::name>,
    QUVAHOST_OPS(QUVAHOST_FAKE_HOOK)
#undef QUVAHOST_FAKE_HOOK
};

int Refuse(int code) { return HostFail(code, __FILE__, __LINE__); }

void ShareFree(ShareRecord* record) {
  if (record != nullptr) --g_state->outstanding_records;
  g_state->previous.ShareFree(record);
}

// --- typed answers -----------------------------------------------------------

// `text` if it fits; conversions cut it on a character boundary instead.
int CopyAnswer(HostOp op, char* out, int size) {
  const std::string& text = Op(op).text;
  bool cut =
      op == HostOp::kUnicodeStrUTF16ToUTF8 || op == HostOp::kUnicodeStrCPToUTF8;
  if (out == nullptr || size < 1) return Refuse(cut ? EINVAL : ERANGE);
  if (!cut && text.size() >= size_t(size)) return Refuse(ERANGE);
  size_t length = std::min(text.size(), size_t(size) - 1);
  while (length > 0 && length < text.size() &&
         (static_cast<unsigned char>(text[length]) & 0xC0) == 0x80)
    --length;  // back to a character boundary
  memcpy(out, text.data(), length);
  out[length] = '\0';
  return static_cast<int>(length);
}

}  // namespace

FakeHost::FakeHost() {
  g_state = new FakeState;
  previous_ = SetHostOps(&kHooks);
  g_state->previous = g_state->next = previous_;
  g_state->next.ShareFree = ShareFree;  // counts the releases
}

FakeHost::~FakeHost() {
  SetHostOps(&previous_);
  delete g_state;
  g_state = nullptr;
}

void FakeHost::Fail(HostOp op, int code, int result) {
  Op(op).fail = true;
  Op(op).fail_code = code;
  Op(op).fail_result = result;
}

void FakeHost::Answer(HostOp op, std::initializer_list<int> results) {
  Op(op).answers.assign(results);
  Op(op).next_answer = 0;
}

void FakeHost::Pass(HostOp op) {
  Op(op).fail = false;
  Op(op).answers.clear();
}

void FakeHost::AnswerFileStat(const QLIBCFileStatRecord& record) {
  g_state->stat_record = record;
  g_state->next.FileStat = [](const char*, int, QLIBCFileStatRecord* out) {
    return out == nullptr ? Refuse(EINVAL) : (*out = g_state->stat_record, 0);
  };
}

void FakeHost::AnswerSectionValue(const std::string& value) {
  Op(HostOp::kFileGetSectionValue).text = value;
  g_state->next.FileGetSectionValue = [](const char*, const char*, const char*,
                                         char* buffer, int size) {
    return CopyAnswer(HostOp::kFileGetSectionValue, buffer, size);
  };
}

void FakeHost::AnswerConversion(HostOp op, const std::string& utf8) {
  Op(op).text = utf8;
  if (op == HostOp::kUnicodeStrUTF16ToUTF8) {
    g_state->next.UnicodeStrUTF16ToUTF8 = [](const char*, char* out, int size) {
      return CopyAnswer(HostOp::kUnicodeStrUTF16ToUTF8, out, size);
    };
  } else {
    g_state->next.UnicodeStrCPToUTF8 = [](int, const char*, char* out, int n) {
      return CopyAnswer(HostOp::kUnicodeStrCPToUTF8, out, n);
    };
  }
}

void FakeHost::HandOutRecordsOnFailure() { g_state->records_on_failure = true; }

int FakeHost::OutstandingShareRecords() const {
  return g_state->outstanding_records;
}

int FakeHost::Calls(HostOp op) const { return Op(op).calls; }

}  // namespace quvahost::test
