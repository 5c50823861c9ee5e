// Loading the base API library: once, with gaps, or not at all. Each test is a process of its own.
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>

namespace {

namespace fs = std::filesystem;

/// Copies of the libraries under test in a folder of their own, with the given base API library beside them or
/// none: libzn_gscl.so looks beside itself, and a build has the real one there.
class Loader : public testing::Test {
 protected:
  void SetUp() override {
    std::string name = (fs::temp_directory_path() / "gscl_loader_XXXXXX").string();
    ASSERT_NE(mkdtemp(name.data()), nullptr);
    folder_ = name;
    for (const auto& file : fs::directory_iterator(LIBRARY_FOLDER)) {
      if (file.path().extension() == ".so" && file.path().filename() != "libwyx_r.so") fs::copy(file, folder_);
    }
  }
  void TearDown() override { fs::remove_all(folder_); }

  void provideBaseApi() { fs::copy(PARTIAL_BASE_API, folder_ / "libwyx_r.so"); }

  struct Result {
    std::string output;
    int status;
  };
  Result run(const std::string& mode) {
    const std::string command = "LD_LIBRARY_PATH=" + folder_.string() + " exec " LOADER_PROBE " " + mode + " 2>&1";
    FILE* pipe = popen(command.c_str(), "r");
    Result result;
    char buffer[512];
    while (size_t n = fread(buffer, 1, sizeof buffer, pipe)) result.output.append(buffer, n);
    result.status = pclose(pipe);
    return result;
  }

  fs::path folder_;
};

TEST_F(Loader, Missing_saysSoAndAborts) {
  const Result result = run("query");
  EXPECT_TRUE(WIFSIGNALED(result.status) || WEXITSTATUS(result.status) != 0);
  EXPECT_TRUE(result.output.starts_with("dlopen libwyx_r.so errno=")) << result.output;
  EXPECT_NE(result.output.find("Assertion"), std::string::npos);
}

TEST_F(Loader, EntryPointsThatAreMissing_areNotSupported) {
  provideBaseApi();
  const Result result = run("query");
  EXPECT_EQ(result.status, 0) << result.output;
}

TEST_F(Loader, FirstOperationsOfManyThreads_loadOnce) {
  provideBaseApi();
  const Result result = run("race");
  EXPECT_EQ(result.status, 0) << result.output;
}

TEST_F(Loader, DestroyedController_loadsNothing) {
  const Result result = run("destroy");
  EXPECT_EQ(result.status, 0) << result.output;
}

}  // namespace
