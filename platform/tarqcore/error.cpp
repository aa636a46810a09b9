#include <tarq/core.h>

namespace {

// Nothing reads the position back: it is there for whoever looks at a core file or a debugger.
struct ErrorState {
    int code = TARQ_ERR_NONE;
    const char* file = "";
    int line = 0;
};

thread_local ErrorState error_state;

}  // namespace

int KAPICErrGet(void) {
    return error_state.code;
}

void KAPICErrSetEx(int code, const char* file, int line) {
    error_state = {code, file, line};
}

const char* KAPICErrText(int code) {
    switch (code) {
        case TARQ_ERR_NONE:
            return "no error";
        case TARQ_ERR_NO_MEMORY:
            return "out of memory";
        case TARQ_ERR_OPEN_FILE:
            return "cannot open the file";
        case TARQ_ERR_READ_FILE:
            return "cannot read the file";
        case TARQ_ERR_WRITE_FILE:
            return "cannot write the file";
        case TARQ_ERR_BAD_PARAMETER:
            return "an argument is missing or not allowed";
        case TARQ_ERR_SEMAPHORE:
            return "a lock between processes cannot be taken; the system log says why";
        case TARQ_ERR_NO_SHARE:
            return "no such share";
        case TARQ_ERR_SHARE_VOLUME:
            return "the share's volume is not mounted where it was when the share was added";
        case TARQ_ERR_SHARE_EXISTS:
            return "there is a share of that name already";
        case TARQ_ERR_SHARE_OVERLAP:
            return "the folder holds, or lies in, another share's";
        case TARQ_ERR_SHARE_FOLDER:
            return "the share's folder is not there, or is no folder that can be read";
        case TARQ_ERR_SHARE_IDENTITY:
            return "another folder, or one on another disk, stands where the share's was";
        case TARQ_ERR_NO_KEY:
            return "no such key";
        case TARQ_ERR_NO_SECTION:
            return "no such section";
        case TARQ_ERR_NO_VOLUME:
            return "the path lies on no volume, or cannot be examined";
        case TARQ_ERR_LOOKUP:
            return "the name service failed";
        case TARQ_ERR_SERVICE:
            return "the service manager refused or cannot be reached";
        case TARQ_ERR_SERVICE_BUSY:
            return "the service is being started already";
        default:
            return "unknown error";
    }
}
