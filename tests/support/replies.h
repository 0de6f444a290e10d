// The fixed replies of the debug service, byte for byte.
#pragma once

inline constexpr char BAD_REQUEST[] =
    "HTTP/1.0 400 Bad Request\r\nContent-Type: text/plain\r\n\r\n"
    "The request has bad syntax or was inherently impossible to satisfy\n";

inline constexpr char SERVER_ERROR[] =
    "HTTP/1.0 500 Internal Server Error\r\nContent-Type: text/plain\r\n\r\n"
    "The server encountered an internal error and could not complete the request\n";

inline constexpr char BUSY[] =
    "HTTP/1.0 503 Service Unavailable\r\nCache-Control: no-cache\r\n"
    "Expires: Thu, 01 Dec 1994 16:00:00 GMT\r\nContent-Type: text/html\r\n\r\n"
    "<HTML><HEAD></HEAD>\r\n<BODY>\r\n"
    "Another Crash Report generation is in progress. Please try again later ... \r\n"
    "</BODY></HTML>\r\n\r\n";
