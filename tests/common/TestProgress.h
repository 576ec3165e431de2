#pragma once
// A test's last step, which the test programs print when a test runs for
// longer than a test runner would wait: a hang then says where it is.
void TestStep(const char *step);
const char *LastTestStep();
