// Test fixtures: a temporary control directory and a clean control block.
#pragma once

#include <gtest/gtest.h>

#include <string>

#include "Utility/rndctl/rndctl.h"

/// Frees every record list of the control block and clears it, keeping
/// nothing from an earlier test.
void rndctl_reset();

/// Writes `content` to `path` (replacing it); returns false on failure.
bool write_text_file(const std::string& path, const std::string& content);
/// The whole content of `path`, or "" when it cannot be read.
std::string read_text_file(const std::string& path);
/// Removes a directory tree (for cleanup; errors are ignored).
void remove_tree(const std::string& path);

/// A fresh control directory under the temporary directory, made the control
/// block's control directory, with the host name "testhost" and this pid.
class ControlDirTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  std::string path(const std::string& name) const { return dir_ + "/" + name; }
  void write_file(const std::string& name, const std::string& content) const {
    ASSERT_TRUE(write_text_file(path(name), content)) << name;
  }
  std::string read_file(const std::string& name) const { return read_text_file(path(name)); }

  std::string dir_;
};
