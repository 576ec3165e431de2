#pragma once
// Names a test's current step: the test programs print the last one named
// when a test runs longer than a test runner would wait, so that a hang
// says where it is.
void TestStep(const char *step);
