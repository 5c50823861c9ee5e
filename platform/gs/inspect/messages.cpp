#include "inspect/messages.h"

#include <flatbuffers/minireflect.h>

#include <algorithm>
#include <stdexcept>
#include <vector>

namespace gs::inspect {
namespace {

std::string bytes_of(const flatbuffers::FlatBufferBuilder& builder) {
  return {reinterpret_cast<const char*>(builder.GetBufferPointer()), builder.GetSize()};
}

/// Aligned as a reader wants it, which a part of another message need not be.
std::vector<std::uint64_t> aligned(std::span<const std::byte> bytes) {
  std::vector<std::uint64_t> copy((bytes.size() + sizeof(std::uint64_t) - 1) / sizeof(std::uint64_t));
  std::copy(bytes.begin(), bytes.end(), reinterpret_cast<std::byte*>(copy.data()));
  return copy;
}

/// Many parts of a message may be the same bytes of it: taken apart they would need any memory.
class Sum : public flatbuffers::IterationVisitor {
 public:
  explicit Sum(std::size_t most) : left_(most) {}

 private:
  void take(std::size_t bytes) {
    if (bytes > left_) throw std::length_error("more than its bytes");
    left_ -= bytes;
  }
  void String(const flatbuffers::String* text) override { take(text->size()); }
  void StartVector() override { take(sizeof(flatbuffers::uoffset_t)); }
  void StartSequence() override { take(sizeof(flatbuffers::soffset_t)); }

  std::size_t left_;
};

template <typename Table>
std::optional<typename Table::NativeTableType> read(std::span<const std::byte> bytes, std::string* error) {
  constexpr flatbuffers::uoffset_t kMaxDepth = 8;  // of tables in tables; the schema needs five
  const auto copy = aligned(bytes);
  const auto* data = reinterpret_cast<const std::uint8_t*>(copy.data());
  flatbuffers::Verifier verifier(data, bytes.size(), kMaxDepth);
  *error = "not a well-formed question or report";
  if (bytes.size() > kMaxBytes || !verifier.VerifyBuffer<Table>(nullptr)) return std::nullopt;
  Sum sum(bytes.size());
  try {
    flatbuffers::IterateFlatBuffer(data, Table::MiniReflectTypeTable(), &sum);
  } catch (const std::length_error&) {
    return std::nullopt;
  }
  typename Table::NativeTableType value;
  flatbuffers::GetRoot<Table>(data)->UnPackTo(&value);
  return value;
}

}  // namespace

std::string write(const AskT& ask) {
  flatbuffers::FlatBufferBuilder builder;
  builder.Finish(Ask::Pack(builder, &ask));
  return bytes_of(builder);
}

std::string write(const ReportT& report) {
  flatbuffers::FlatBufferBuilder builder;
  builder.Finish(Report::Pack(builder, &report));
  return bytes_of(builder);
}

std::optional<AskT> read_ask(std::span<const std::byte> bytes, std::string* error) {
  auto ask = read<Ask>(bytes, error);
  if (ask && (ask->what > What::MAX || ask->groups.size() > kMaxGroupsAsked)) {
    *error = "a question of an unknown kind, or about too many groups";
    return std::nullopt;
  }
  return ask;
}

std::optional<ReportT> read_report(std::span<const std::byte> bytes, std::string* error) {
  auto report = read<Report>(bytes, error);
  if (!report) return report;
  // What this reader does not know is not there.
  std::erase_if(report->happenings, [](const auto& h) { return h->kind > Kind::MAX; });
  return report;
}

}  // namespace gs::inspect
