// Every entry of g_host_ops becomes a hook that counts the call, applies a
// failure or int answer, and otherwise calls its entry of the "next" table:
// the previous operation, a typed answer, or the in-memory shares.
#include "support/fake_host.h"

#include <string.h>

#include <algorithm>
#include <map>
#include <type_traits>

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
};

struct FakeState {
  HostOps previous{}, next{};
  OpState ops[static_cast<int>(HostOp::kCount)];
  std::string ea_dir_path, section_value, utf16_answer, cp_answer;
  int code_page = 0;
  QLIBCFileStatRecord stat_record{};
  // In-memory shares: name to normalized path and status.
  std::map<std::string, std::pair<std::string, unsigned>> shares;
  std::vector<std::pair<std::string, unsigned>> share_updates;
  int outstanding_records = 0;
};

FakeState* g_state = nullptr;

OpState& Op(HostOp op) { return g_state->ops[static_cast<int>(op)]; }

template <typename T>
void ClearShareOutput(T) {}
void ClearShareOutput(ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
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
      (ClearShareOutput(args), ...);
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
    }
    return (g_state->next.*kSlot)(args...);
  }
};

// clang-format off
#define HOOK(name) \
  &HookFor<HostOp::k##name, decltype(HostOps::name)>::Call<&HostOps::name>
constexpr HostOps kHooks = {
    HOOK(ShareGet), HOOK(ShareGetByAttrStr), HOOK(ShareUpdate),
    HOOK(ShareFree), HOOK(GetFSType), HOOK(FSIsRemoteFS), HOOK(FSIsImageFS),
    HOOK(EADirPath), HOOK(EAMKDir), HOOK(EAIsHiddenDir),
    HOOK(SystemGetBootStep), HOOK(ErrGet), HOOK(ErrorGetFile),
    HOOK(ErrorGetLine), HOOK(FileGetLine), HOOK(FileGetSectionValue),
    HOOK(FileStat), HOOK(ReadPidFile), HOOK(ProcAliveByPidFile),
    HOOK(CodePageGet), HOOK(UnicodeStrUTF16ToUTF8), HOOK(UnicodeStrCPToUTF8),
    HOOK(UnicodeUTF8StrCountChar), HOOK(UnicodeUTF8ForwardNChar)};
#undef HOOK
// clang-format on

int Refuse(int code) { return HostFail(code, __FILE__, __LINE__); }

// --- shares: the file's or the in-memory ones, records counted --------------

int Counted(int result, ShareRecord** record) {
  if (record != nullptr && *record != nullptr) ++g_state->outstanding_records;
  return result;
}

using Shares = std::map<std::string, std::pair<std::string, unsigned>>;

int HandOut(Shares::const_iterator it, ShareRecord** record) {
  if (it == g_state->shares.end()) return Refuse(ENOENT);
  int error = 0;
  *record =
      NewShareRecord(it->first, it->second.first, it->second.second, &error);
  return Counted(*record != nullptr ? 0 : Refuse(error), record);
}

int ShareGet(const char* name, ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
  if (g_state->shares.empty())
    return Counted(g_state->previous.ShareGet(name, record), record);
  if (name == nullptr || record == nullptr) return Refuse(EINVAL);
  return HandOut(g_state->shares.find(name), record);
}

// The share with the longest path that holds `value`.
int ShareGetByAttrStr(const char* value, int attribute, ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
  if (g_state->shares.empty()) {
    return Counted(
        g_state->previous.ShareGetByAttrStr(value, attribute, record), record);
  }
  std::string path;
  if (value == nullptr || record == nullptr ||
      attribute != QUVA_SHARE_ATTR_PATH || !NormalizeAbsolutePath(value, &path))
    return Refuse(EINVAL);
  auto best = g_state->shares.cend();
  for (auto it = g_state->shares.cbegin(); it != g_state->shares.cend(); ++it) {
    if (ShareHoldsPath(it->second.first, path) &&
        (best == g_state->shares.cend() ||
         it->second.first.size() > best->second.first.size()))
      best = it;
  }
  return HandOut(best, record);
}

int ShareUpdate(const ShareRecord* record) {
  if (g_state->shares.empty()) return g_state->previous.ShareUpdate(record);
  if (record == nullptr) return Refuse(EINVAL);
  auto it = g_state->shares.find(record->szName);
  if (it == g_state->shares.end()) return Refuse(ENOENT);
  it->second.second = record->uStatus;
  g_state->share_updates.emplace_back(it->first, record->uStatus);
  return 0;
}

void ShareFree(ShareRecord* record) {
  if (record != nullptr) --g_state->outstanding_records;
  g_state->previous.ShareFree(record);
}

// --- typed answers -----------------------------------------------------------

int CopyAnswer(const std::string& text, char* buffer, int size) {
  if (buffer == nullptr || size < 1 || text.size() >= size_t(size))
    return Refuse(ERANGE);
  memcpy(buffer, text.c_str(), text.size() + 1);
  return static_cast<int>(text.size());
}

int CutAnswer(const std::string& utf8, char* out, int out_size) {
  if (out == nullptr || out_size < 1) return Refuse(EINVAL);
  size_t length = std::min(utf8.size(), size_t(out_size) - 1);
  while (length > 0 && length < utf8.size() &&
         (static_cast<unsigned char>(utf8[length]) & 0xC0) == 0x80) {
    --length;  // back to a character boundary
  }
  memcpy(out, utf8.data(), length);
  out[length] = '\0';
  return static_cast<int>(length);
}

}  // namespace

FakeHost::FakeHost() : previous_(g_host_ops) {
  g_state = new FakeState;
  g_state->previous = g_state->next = previous_;
  g_state->next.ShareGet = ShareGet;
  g_state->next.ShareGetByAttrStr = ShareGetByAttrStr;
  g_state->next.ShareUpdate = ShareUpdate;
  g_state->next.ShareFree = ShareFree;
  g_host_ops = kHooks;
}

FakeHost::~FakeHost() {
  g_host_ops = previous_;
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

void FakeHost::AnswerEADirPath(const std::string& path) {
  g_state->ea_dir_path = path;
  g_state->next.EADirPath = [](int, const char*, char* buffer, int size) {
    return CopyAnswer(g_state->ea_dir_path, buffer, size) < 0 ? -1 : 0;
  };
}

void FakeHost::AnswerCodePage(int code_page) {
  g_state->code_page = code_page;
  g_state->next.CodePageGet = [](int, int* out) {
    if (out == nullptr) return Refuse(EINVAL);
    *out = g_state->code_page;
    return 0;
  };
}

void FakeHost::AnswerFileStat(const QLIBCFileStatRecord& record) {
  g_state->stat_record = record;
  g_state->next.FileStat = [](const char*, int, QLIBCFileStatRecord* out) {
    if (out == nullptr) return Refuse(EINVAL);
    *out = g_state->stat_record;
    return 0;
  };
}

void FakeHost::AnswerSectionValue(const std::string& value) {
  g_state->section_value = value;
  g_state->next.FileGetSectionValue = [](const char*, const char*, const char*,
                                         char* buffer, int size) {
    return CopyAnswer(g_state->section_value, buffer, size);
  };
}

void FakeHost::AnswerConversion(HostOp op, const std::string& utf8) {
  if (op == HostOp::kUnicodeStrUTF16ToUTF8) {
    g_state->utf16_answer = utf8;
    g_state->next.UnicodeStrUTF16ToUTF8 = [](const char*, char* out, int size) {
      return CutAnswer(g_state->utf16_answer, out, size);
    };
  } else {
    g_state->cp_answer = utf8;
    g_state->next.UnicodeStrCPToUTF8 = [](int, const char*, char* out,
                                          int size) {
      return CutAnswer(g_state->cp_answer, out, size);
    };
  }
}

void FakeHost::AddShare(const std::string& name, const std::string& path,
                        unsigned status) {
  std::string normal;
  g_state->shares[name] = {NormalizeAbsolutePath(path, &normal) ? normal : path,
                           status};
}

unsigned FakeHost::ShareStatus(const std::string& name) const {
  auto it = g_state->shares.find(name);
  return it == g_state->shares.end() ? 0 : it->second.second;
}

const std::vector<std::pair<std::string, unsigned>>& FakeHost::ShareUpdates()
    const {
  return g_state->share_updates;
}

int FakeHost::OutstandingShareRecords() const {
  return g_state->outstanding_records;
}

int FakeHost::Calls(HostOp op) const { return Op(op).calls; }

}  // namespace quvahost::test
