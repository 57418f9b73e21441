# Fish completion for rolvane and RolvaneManager. The program itself knows what there is.

function __rolvane_complete
    set -l words (commandline -opc)
    set -l program rolvane
    string match -q '*RolvaneManager' -- $words[1]; or set program $words[1]
    set -l reply ($program complete fish $words (commandline -ct) 2>/dev/null)
    switch "$reply[1]"
        case files
            __fish_complete_path (commandline -ct)
        case directories
            __fish_complete_directories (commandline -ct)
        case offers
            set -e reply[1]
            printf '%s\n' $reply
    end
end

complete -c rolvane -f -k -a '(__rolvane_complete)'
complete -c RolvaneManager -f -k -a '(__rolvane_complete)'
