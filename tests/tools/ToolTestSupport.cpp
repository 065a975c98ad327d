#include "ToolTestSupport.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>

namespace gwtest {

ToolRun runTool(const std::string& arguments) {
    char errorPath[] = "/tmp/gwarchive-stderr-XXXXXX";
    int descriptor = mkstemp(errorPath);
    if (descriptor >= 0)
        close(descriptor);
    // Never the test's terminal, where the tool would ask for passwords; an
    // input redirection among the arguments comes later and wins.
    CommandResult result = runCommand(std::string(GW_TOOL_PATH) + " </dev/null " + arguments +
                                      " 2>" + shellQuote(errorPath));
    GWData error = readFile(errorPath);
    unlink(errorPath);
    return {result.status, result.output, std::string(error.begin(), error.end())};
}

MeasuredToolRun runToolMeasured(const std::vector<std::string>& arguments) {
    TemporaryDirectory directory;
    const std::string errorPath = directory.file("stderr");
    const std::string residentPath = directory.file("resident");
    // A child forked from this test process starts with its resident pages,
    // and exec keeps that high-water mark: /usr/bin/time, small itself,
    // reports the tool's own.
    std::vector<std::string> words{"/usr/bin/time", "-f", "%M", "-o", residentPath, GW_TOOL_PATH};
    words.insert(words.end(), arguments.begin(), arguments.end());
    std::vector<char*> argv;
    for (auto& word : words)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    MeasuredToolRun run;
    const pid_t child = fork();
    if (child == 0) {
        // Only async-signal-safe calls between fork and exec.
        const int error = open(errorPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        const int null = open("/dev/null", O_WRONLY);
        if (error < 0 || null < 0 || dup2(error, 2) < 0 || dup2(null, 1) < 0)
            _exit(127);
        execv(argv[0], argv.data());
        _exit(127);
    }
    if (child < 0)
        return run;
    int status = 0;
    if (waitpid(child, &status, 0) == child && WIFEXITED(status))
        run.status = WEXITSTATUS(status);
    // The figure is the last line; a failing tool adds one about its status before it.
    const GWData resident = readFile(residentPath);
    std::string text(resident.begin(), resident.end());
    while (!text.empty() && text.back() == '\n')
        text.pop_back();
    run.maxResidentKiB = std::atol(text.substr(text.rfind('\n') + 1).c_str());
    const GWData error = readFile(errorPath);
    run.err.assign(error.begin(), error.end());
    return run;
}

std::string describeTree(const std::string& root) {
    // Python walks without following links and reads link texts as they are.
    static const char kScript[] =
        "import os, stat, sys\n"
        "root = sys.argv[1]\n"
        "lines = []\n"
        "for d, dirs, files in os.walk(root):\n"
        "    for n in dirs + files:\n"
        "        p = os.path.join(d, n)\n"
        "        s = os.lstat(p)\n"
        "        r = os.path.relpath(p, root)\n"
        "        if stat.S_ISLNK(s.st_mode): what = 'link ' + os.readlink(p)\n"
        "        elif stat.S_ISDIR(s.st_mode): what = 'dir'\n"
        "        elif stat.S_ISREG(s.st_mode): what = 'file %d %s' % (s.st_size, "
        "__import__('hashlib').sha1(open(p, 'rb').read()).hexdigest())\n"
        "        else: what = 'special %o' % stat.S_IFMT(s.st_mode)\n"
        "        mode = '' if stat.S_ISLNK(s.st_mode) else ' %o' % stat.S_IMODE(s.st_mode)\n"
        "        lines.append(r + ' ' + what + mode)\n"
        "print('\\n'.join(sorted(lines)))\n";
    return runCommand("python3 -c " + shellQuote(kScript) + " " + shellQuote(root)).output;
}

}  // namespace gwtest
