// Interoperation with an independent CBOR implementation (the Python cbor2
// module, which the example client uses): it must read what we write, and we
// must read what it writes. One interpreter launch does both directions.

#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <limits>
#include <optional>
#include <string>
#include <vector>

#include "platform/value/Cbor.h"
#include "tests/platform/value/CborTestSupport.h"

namespace tn {
namespace {

constexpr const char* kPython = "/usr/bin/python3";

// Reads the hex of our encoding from argv[1] and checks it against the value
// it should be; then prints the hex of its own encodings for us to read.
constexpr const char* kScript = R"PY(
import sys
try:
    import cbor2
except ImportError:
    print("NO_CBOR2")
    sys.exit(0)
import datetime, math, uuid
ours = cbor2.loads(bytes.fromhex(sys.argv[1]))
expected = {
    "unsigned": 18446744073709551615,
    "negative": -9223372036854775808,
    "minusOne": -1,
    "uuid": uuid.UUID("e621e1f8-c36c-495a-93fc-0c247a3e6e5f"),
    "bytes": b"\x00\x01\xff",
    "float": 1.5,
    "date": datetime.datetime(2013, 3, 21, 20, 4, 0, 500000, tzinfo=datetime.timezone.utc),
    "nested": {"list": ["a", "\u00e9\u20ac"], "flag": True, "none": None},
}
same = ours == expected and type(ours["float"]) is float and math.copysign(1, ours["float"]) == 1
print("DECODED " + ("same" if same else repr(ours)))
theirs = {
    "unsigned": 18446744073709551615,
    "negative": -9223372036854775808,
    "small": 7,
    "uuid": uuid.UUID("e621e1f8-c36c-495a-93fc-0c247a3e6e5f"),
    "bytes": b"\x00\x01\xff",
    "float": 0.1,
    "date": datetime.datetime(2013, 3, 21, 20, 4, 0, tzinfo=datetime.timezone.utc),
    "nested": {"list": ["a"], "flag": False},
}
print("THEIRS " + cbor2.dumps(theirs, datetime_as_timestamp=True).hex())
print("HALF " + cbor2.dumps(1.5, canonical=True).hex())
)PY";

// Runs the script with one argument and returns its standard output followed
// by an "EXIT <status>" line, or none when no process could be started.
std::optional<std::string> runPython(const std::string& argument) {
  int fds[2];
  if (pipe(fds) != 0) return std::nullopt;
  const pid_t pid = fork();
  if (pid < 0) return std::nullopt;
  if (pid == 0) {
    dup2(fds[1], STDOUT_FILENO);
    close(fds[0]);
    close(fds[1]);
    execl(kPython, kPython, "-c", kScript, argument.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  close(fds[1]);
  std::string output;
  char buffer[4096];
  ssize_t n;
  while ((n = read(fds[0], buffer, sizeof buffer)) > 0) output.append(buffer, static_cast<size_t>(n));
  close(fds[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  output += fmt::format("EXIT {}\n", WIFEXITED(status) ? WEXITSTATUS(status) : -1);
  return output;
}

std::string lineAfter(const std::string& output, const std::string& label) {
  const size_t start = output.find(label + " ");
  if (start == std::string::npos) return {};
  const size_t end = output.find('\n', start);
  return output.substr(start + label.size() + 1, end - start - label.size() - 1);
}

const UUID kUUID = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");

TEST(CborInterop, AnotherImplementationReadsOursAndWeReadIts) {
  if (access(kPython, X_OK) != 0) GTEST_SKIP() << kPython << " is not installed";
  const Value ours(Dictionary{
      {"unsigned", Value(std::numeric_limits<uint64_t>::max())},
      {"negative", Value(std::numeric_limits<int64_t>::min())},
      {"minusOne", Value(-1)},
      {"uuid", Value(kUUID)},
      {"bytes", Value(Bytes{0x00, 0x01, 0xFF})},
      {"float", Value(1.5)},
      {"date", Value(Date{1363896240.5})},
      {"nested", Value(Dictionary{{"list", Value(Array{Value("a"), Value("\xC3\xA9\xE2\x82\xAC")})},
                                  {"flag", Value(true)},
                                  {"none", Value()}})},
  });
  std::optional<std::string> output = runPython(test::toHex(encodeCbor(ours)));
  ASSERT_TRUE(output) << "could not run " << kPython;
  if (output->find("NO_CBOR2") != std::string::npos) GTEST_SKIP() << "python3-cbor2 is not installed";

  ASSERT_EQ(lineAfter(*output, "EXIT"), "0") << *output;
  EXPECT_EQ(lineAfter(*output, "DECODED"), "same");

  Result<Value> theirs = decodeMessageBody(test::hexBytes(lineAfter(*output, "THEIRS")));
  ASSERT_TRUE(theirs.ok()) << theirs.error().description();
  const Value expected(Dictionary{
      {"unsigned", Value(std::numeric_limits<uint64_t>::max())},
      {"negative", Value(std::numeric_limits<int64_t>::min())},
      {"small", Value(uint64_t{7})},
      {"uuid", Value(kUUID)},
      {"bytes", Value(Bytes{0x00, 0x01, 0xFF})},
      {"float", Value(0.1)},
      {"date", Value(Date{1363896240})},
      {"nested", Value(Dictionary{{"list", Value(Array{Value("a")})}, {"flag", Value(false)}})},
  });
  EXPECT_TRUE(Value::identical(*theirs, expected)) << theirs->description();

  Result<Value> half = decodeCbor(test::hexBytes(lineAfter(*output, "HALF")));
  ASSERT_TRUE(half.ok());
  EXPECT_TRUE(Value::identical(*half, Value(1.5)));
}

}  // namespace
}  // namespace tn
