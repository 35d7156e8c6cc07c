// The fake swaps every entry of quvahost::g_host_ops for a hook. A hook
// counts the call, then applies a configured failure or int answer, and
// otherwise calls the entry of its "next" table: the previous operation, or
// a typed answer or the in-memory shares where configured.
#include "support/fake_host.h"

#include <string.h>

#include <map>
#include <type_traits>

#include "host_error.h"
#include "share_db.h"

namespace quvahost::test {
namespace {

constexpr int kOpCount = static_cast<int>(HostOp::kCount);

struct OpState {
  int calls = 0;  // calls since installation
  enum { kPass, kAlways, kNth } fail = kPass;
  int fail_at = 0;           // kNth: the call number that fails
  int fail_code = 0;         // error code of a failing call
  int fail_result = -1;      // result of a failing int call
  std::vector<int> answers;  // int answers; the last repeats
  size_t next_answer = 0;    // index of the next int answer
};

struct MemShare {
  std::string path;     // normalized path on disk
  unsigned status = 0;  // status flags
};

struct FakeState {
  HostOps previous{};                 // installed before the fake
  HostOps next{};                     // what each hook calls when it passes
  OpState ops[kOpCount];              // per-operation configuration
  std::string ea_dir_path;            // AnswerEADirPath
  int code_page = 0;                  // AnswerCodePage
  QLIBCFileStatRecord stat_record{};  // AnswerFileStat
  std::string file_line;              // AnswerFileLine
  std::string section_value;          // AnswerSectionValue
  std::string utf16_answer;  // AnswerConversion(kUnicodeStrUTF16ToUTF8)
  std::string cp_answer;     // AnswerConversion(kUnicodeStrCPToUTF8)
  std::map<std::string, MemShare> shares;  // AddShare
  std::vector<std::pair<std::string, unsigned>> share_updates;
  int outstanding_records = 0;  // handed out, not yet freed
};

FakeState* g_state = nullptr;

// --- the generic hook -------------------------------------------------------

template <typename T>
void ClearShareOutput(T) {}
void ClearShareOutput(ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
}

template <typename R>
R FailedResult(int result) {
  if constexpr (std::is_void_v<R>) {
    return;
  } else if constexpr (std::is_pointer_v<R>) {
    return nullptr;
  } else {
    return static_cast<R>(result);
  }
}

bool ShouldFail(const OpState& op) {
  return op.fail == OpState::kAlways ||
         (op.fail == OpState::kNth && op.calls == op.fail_at);
}

template <HostOp kOp, typename Fn>
struct HookFor;

template <HostOp kOp, typename R, typename... A>
struct HookFor<kOp, R (*)(A...)> {
  template <R (*HostOps::*kSlot)(A...)>
  static R Call(A... args) {
    OpState& op = g_state->ops[static_cast<int>(kOp)];
    ++op.calls;
    if (ShouldFail(op)) {
      (ClearShareOutput(args), ...);
      HostFail(op.fail_code, __FILE__, __LINE__);
      return FailedResult<R>(op.fail_result);
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

#define FAKE_HOST_HOOK(name) \
  &HookFor<HostOp::k##name,  \
           decltype(HostOps::name)>::template Call<&HostOps::name>

constexpr HostOps kHooks = {
    FAKE_HOST_HOOK(ShareGet),
    FAKE_HOST_HOOK(ShareGetByAttrStr),
    FAKE_HOST_HOOK(ShareUpdate),
    FAKE_HOST_HOOK(ShareFree),
    FAKE_HOST_HOOK(GetFSType),
    FAKE_HOST_HOOK(FSIsRemoteFS),
    FAKE_HOST_HOOK(FSIsImageFS),
    FAKE_HOST_HOOK(EADirPath),
    FAKE_HOST_HOOK(EAMKDir),
    FAKE_HOST_HOOK(EAIsHiddenDir),
    FAKE_HOST_HOOK(SystemGetBootStep),
    FAKE_HOST_HOOK(ErrGet),
    FAKE_HOST_HOOK(ErrorGetFile),
    FAKE_HOST_HOOK(ErrorGetLine),
    FAKE_HOST_HOOK(FileGetLine),
    FAKE_HOST_HOOK(FileGetSectionValue),
    FAKE_HOST_HOOK(FileStat),
    FAKE_HOST_HOOK(ReadPidFile),
    FAKE_HOST_HOOK(ProcAliveByPidFile),
    FAKE_HOST_HOOK(CodePageGet),
    FAKE_HOST_HOOK(UnicodeStrUTF16ToUTF8),
    FAKE_HOST_HOOK(UnicodeStrCPToUTF8),
    FAKE_HOST_HOOK(UnicodeUTF8StrCountChar),
    FAKE_HOST_HOOK(UnicodeUTF8ForwardNChar),
};

#undef FAKE_HOST_HOOK

int Fail(int code) { return HostFail(code, __FILE__, __LINE__); }

// --- share records: counted hand-out and release ---------------------------

// What the counted lookups call: the previous operations or the in-memory
// shares.
int (*g_share_get)(const char*, ShareRecord**) = nullptr;
int (*g_share_get_by_attr)(const char*, int, ShareRecord**) = nullptr;

int CountedShareGet(const char* name, ShareRecord** record) {
  int result = g_share_get(name, record);
  if (record != nullptr && *record != nullptr) ++g_state->outstanding_records;
  return result;
}

int CountedShareGetByAttrStr(const char* value, int attribute,
                             ShareRecord** record) {
  int result = g_share_get_by_attr(value, attribute, record);
  if (record != nullptr && *record != nullptr) ++g_state->outstanding_records;
  return result;
}

void CountedShareFree(ShareRecord* record) {
  if (record != nullptr) --g_state->outstanding_records;
  g_state->previous.ShareFree(record);
}

int HandOut(const std::string& name, const MemShare& share,
            ShareRecord** record) {
  int error = 0;
  ShareRecord* made = NewShareRecord(name, share.path, share.status, &error);
  if (made == nullptr) return Fail(error);
  *record = made;
  return 0;
}

int MemShareGet(const char* name, ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
  if (name == nullptr || record == nullptr) return Fail(EINVAL);
  auto it = g_state->shares.find(name);
  if (it == g_state->shares.end()) return Fail(ENOENT);
  return HandOut(it->first, it->second, record);
}

int MemShareGetByAttrStr(const char* value, int attribute,
                         ShareRecord** record) {
  if (record != nullptr) *record = nullptr;
  std::string path;
  if (value == nullptr || record == nullptr ||
      attribute != QUVA_SHARE_ATTR_PATH ||
      !NormalizeAbsolutePath(value, &path)) {
    return Fail(EINVAL);
  }
  const std::pair<const std::string, MemShare>* best = nullptr;
  for (const auto& entry : g_state->shares) {
    if (ShareHoldsPath(entry.second.path, path) &&
        (best == nullptr ||
         entry.second.path.size() > best->second.path.size())) {
      best = &entry;
    }
  }
  if (best == nullptr) return Fail(ENOENT);
  return HandOut(best->first, best->second, record);
}

int MemShareUpdate(const ShareRecord* record) {
  if (record == nullptr) return Fail(EINVAL);
  auto it = g_state->shares.find(record->szName);
  if (it == g_state->shares.end()) return Fail(ENOENT);
  it->second.status = record->uStatus;
  g_state->share_updates.emplace_back(it->first, record->uStatus);
  return 0;
}

// --- typed answers -----------------------------------------------------------

int AnsweredEADirPath(int, const char*, char* buffer, int size) {
  const std::string& path = g_state->ea_dir_path;
  if (buffer == nullptr || size < 1 ||
      path.size() >= static_cast<size_t>(size)) {
    return Fail(ERANGE);
  }
  memcpy(buffer, path.c_str(), path.size() + 1);
  return 0;
}

int AnsweredCodePage(int, int* code_page) {
  if (code_page == nullptr) return Fail(EINVAL);
  *code_page = g_state->code_page;
  return 0;
}

int AnsweredFileStat(const char*, int, QLIBCFileStatRecord* record) {
  if (record == nullptr) return Fail(EINVAL);
  *record = g_state->stat_record;
  return 0;
}

int CopyAnswer(const std::string& text, char* buffer, int size) {
  if (buffer == nullptr || size < 1 ||
      text.size() >= static_cast<size_t>(size)) {
    return Fail(ERANGE);
  }
  memcpy(buffer, text.c_str(), text.size() + 1);
  return static_cast<int>(text.size());
}

int AnsweredFileLine(const char*, const char*, char* buffer, int size, int) {
  return CopyAnswer(g_state->file_line, buffer, size) < 0 ? -1 : 1;
}

int AnsweredSectionValue(const char*, const char*, const char*, char* buffer,
                         int size) {
  return CopyAnswer(g_state->section_value, buffer, size);
}

int CutAnswer(const std::string& utf8, char* out, int out_size) {
  if (out == nullptr || out_size < 1) return Fail(EINVAL);
  size_t length = utf8.size();
  if (length >= static_cast<size_t>(out_size)) {
    length = static_cast<size_t>(out_size) - 1;
    // Back to a character boundary.
    while (length > 0 &&
           (static_cast<unsigned char>(utf8[length]) & 0xC0) == 0x80) {
      --length;
    }
  }
  memcpy(out, utf8.data(), length);
  out[length] = '\0';
  return static_cast<int>(length);
}

int AnsweredUTF16(const char*, char* out, int out_size) {
  return CutAnswer(g_state->utf16_answer, out, out_size);
}

int AnsweredCP(int, const char*, char* out, int out_size) {
  return CutAnswer(g_state->cp_answer, out, out_size);
}

OpState& Op(HostOp op) { return g_state->ops[static_cast<int>(op)]; }

}  // namespace

FakeHost::FakeHost() : previous_(g_host_ops) {
  g_state = new FakeState;
  g_state->previous = previous_;
  g_state->next = previous_;
  g_share_get = previous_.ShareGet;
  g_share_get_by_attr = previous_.ShareGetByAttrStr;
  g_state->next.ShareGet = CountedShareGet;
  g_state->next.ShareGetByAttrStr = CountedShareGetByAttrStr;
  g_state->next.ShareFree = CountedShareFree;
  g_host_ops = kHooks;
}

FakeHost::~FakeHost() {
  g_host_ops = previous_;
  delete g_state;
  g_state = nullptr;
}

void FakeHost::Fail(HostOp op, int code, int result) {
  OpState& state = Op(op);
  state.fail = OpState::kAlways;
  state.fail_code = code;
  state.fail_result = result;
}

void FakeHost::FailNth(HostOp op, int n, int code, int result) {
  OpState& state = Op(op);
  state.fail = OpState::kNth;
  state.fail_at = state.calls + n;
  state.fail_code = code;
  state.fail_result = result;
}

void FakeHost::Answer(HostOp op, std::initializer_list<int> results) {
  OpState& state = Op(op);
  state.answers.assign(results);
  state.next_answer = 0;
}

void FakeHost::Pass(HostOp op) {
  OpState& state = Op(op);
  state.fail = OpState::kPass;
  state.answers.clear();
  HostOps& next = g_state->next;
  switch (op) {
    case HostOp::kEADirPath:
      next.EADirPath = previous_.EADirPath;
      break;
    case HostOp::kCodePageGet:
      next.CodePageGet = previous_.CodePageGet;
      break;
    case HostOp::kFileStat:
      next.FileStat = previous_.FileStat;
      break;
    case HostOp::kFileGetLine:
      next.FileGetLine = previous_.FileGetLine;
      break;
    case HostOp::kFileGetSectionValue:
      next.FileGetSectionValue = previous_.FileGetSectionValue;
      break;
    case HostOp::kUnicodeStrUTF16ToUTF8:
      next.UnicodeStrUTF16ToUTF8 = previous_.UnicodeStrUTF16ToUTF8;
      break;
    case HostOp::kUnicodeStrCPToUTF8:
      next.UnicodeStrCPToUTF8 = previous_.UnicodeStrCPToUTF8;
      break;
    default:
      break;
  }
}

void FakeHost::AnswerEADirPath(const std::string& path) {
  g_state->ea_dir_path = path;
  g_state->next.EADirPath = AnsweredEADirPath;
}

void FakeHost::AnswerCodePage(int code_page) {
  g_state->code_page = code_page;
  g_state->next.CodePageGet = AnsweredCodePage;
}

void FakeHost::AnswerFileStat(const QLIBCFileStatRecord& record) {
  g_state->stat_record = record;
  g_state->next.FileStat = AnsweredFileStat;
}

void FakeHost::AnswerFileLine(const std::string& line) {
  g_state->file_line = line;
  g_state->next.FileGetLine = AnsweredFileLine;
}

void FakeHost::AnswerSectionValue(const std::string& value) {
  g_state->section_value = value;
  g_state->next.FileGetSectionValue = AnsweredSectionValue;
}

void FakeHost::AnswerConversion(HostOp op, const std::string& utf8) {
  if (op == HostOp::kUnicodeStrUTF16ToUTF8) {
    g_state->utf16_answer = utf8;
    g_state->next.UnicodeStrUTF16ToUTF8 = AnsweredUTF16;
  } else if (op == HostOp::kUnicodeStrCPToUTF8) {
    g_state->cp_answer = utf8;
    g_state->next.UnicodeStrCPToUTF8 = AnsweredCP;
  }
}

void FakeHost::AddShare(const std::string& name, const std::string& path,
                        unsigned status) {
  MemShare share;
  if (!NormalizeAbsolutePath(path, &share.path)) share.path = path;
  share.status = status;
  g_state->shares[name] = share;
  g_share_get = MemShareGet;
  g_share_get_by_attr = MemShareGetByAttrStr;
  g_state->next.ShareUpdate = MemShareUpdate;
}

unsigned FakeHost::ShareStatus(const std::string& name) const {
  auto it = g_state->shares.find(name);
  return it == g_state->shares.end() ? 0 : it->second.status;
}

const std::vector<std::pair<std::string, unsigned>>& FakeHost::ShareUpdates()
    const {
  return g_state->share_updates;
}

int FakeHost::OutstandingShareRecords() const {
  return g_state->outstanding_records;
}

int FakeHost::Calls(HostOp op) const { return Op(op).calls; }

void FakeHost::SetLastError(int code, const char* file, int line) {
  HostFail(code, file, line);
}

}  // namespace quvahost::test
