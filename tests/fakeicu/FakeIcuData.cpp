// A stand-in for ICU's data library: it only has to load.
extern "C" __declspec(dllexport) int icudt24_version()
{
    return 24;
}
